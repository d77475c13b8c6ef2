// isort sort: options, the first pass over a text input, and the sort.
#include <algorithm>
#include <chrono>
#include <climits>
#include <cstdio>
#include <memory>
#include <thread>

#include "ArgParser.h"
#include "Commands.h"
#include "CsvReader.h"
#include "CsvWriter.h"
#include "Errors.h"
#include "Keys.h"
#include "OutputFile.h"
#include "Progress.h"
#include "SortAdapter.h"
#include "Stats.h"
#include "SysIo.h"
#include "host/hostsettings.h"

namespace isortcli {
namespace {

const char kSortHelp[] =
    "usage: isort sort [options] [INPUT] [-o OUTPUT]\n"
    "\n"
    "Sorts a table by typed keys: stably (rows with equal keys keep their order),\n"
    "in bounded memory, with temporary files when the input is larger than that.\n"
    "INPUT and OUTPUT are files; absent or '-' means standard input or output.\n"
    "Output rows are the input rows byte for byte, reordered; a header stays first.\n"
    "\n"
    "Keys (at least one; the first key decides first):\n"
    "  -k, --key COLUMN[:TYPE][:ORDER]\n"
    "        COLUMN  a header name or a 1-based column number (binary: value number)\n"
    "        TYPE    n   numeric; empty or non-numeric fields are missing and sort lowest\n"
    "                sW  a string of at most W bytes, in byte order\n"
    "                s   a string as wide as the column's widest value (default)\n"
    "        ORDER   asc (default) or desc\n"
    "\n"
    "Input format:\n"
    "  (default)           CSV (RFC 4180) whose first row is a header\n"
    "  --no-header         the first row is data\n"
    "  -t, --delimiter C   fields separated by the byte C, CSV quoting kept ('tab' or '\\t': a tab)\n"
    "  --tsv               tab-separated without quoting (quotes are data)\n"
    "  --nvars N           binary records of N raw 8-byte values; numeric keys compare\n"
    "                      the values as doubles, string keys their bytes ('s' alone: 8)\n"
    "\n"
    "Resources:\n"
    "  -m, --memory SIZE   memory target of the sort, e.g. 500M or 2G (at least and by\n"
    "                      default 100M, at most 4G - 1)\n"
    "  -j, --threads N     threads of the sort (default: the machine's; at least 2 are\n"
    "                      used when the input exceeds the memory target)\n"
    "  -T, --tmpdir DIR    directory of temporary files (default: TMPDIR, else /tmp)\n"
    "\n"
    "Reporting:\n"
    "  --quiet             no progress display\n"
    "  --progress          the progress display even when standard error is not a terminal\n"
    "  --stats             a table of the sort's statistics on standard error at the end\n"
    "\n"
    "For measurements and tests:\n"
    "  --pass-through      read, parse and write the rows unsorted (the floor of a sort)\n"
    "  --serial-parse      parse rows on the sort's threads (default with fewer than\n"
    "                      four hardware threads)\n"
    "  --parse-thread      parse rows on a thread of their own (default with four or more)\n"
    "  --row-capacity N    keep at most N bytes of a row in its sort record; longer rows\n"
    "                      wait in a side store (default: chosen from the row lengths)\n"
    "\n"
    "Line ends: each row keeps its own (LF or CR LF). A last row without one that\n"
    "moves up gets the input's predominant line end, and the output ends without a\n"
    "line end exactly when the input does.\n"
    "\n"
    "Exit codes: 0 sorted; 1 bad input data, an unreadable or unwritable file, or a\n"
    "failed sort (such as a full temporary directory); 2 bad usage.\n";

enum {
  kKey = 1, kOutput, kDelimiter, kTsv, kNoHeader, kNvars, kMemory, kThreads, kTmpdir, kQuiet, kProgress,
  kStats, kHelp, kPassThrough, kRowCapacity, kSerialParse, kParseThread
};

struct SortOptions {
  std::string input = "-";
  std::string output = "-";
  std::vector<KeySpec> keys;
  CsvFormat format;
  bool header = true;
  unsigned nvars = 0;  // > 0: binary records
  std::uint64_t memory = 0;
  unsigned threads = 0;
  std::string tmpdir;
  bool quiet = false;
  bool progress = false;
  bool stats = false;
  bool passThrough = false;      // read, parse and write unsorted: the benchmark's floor
  std::uint32_t rowCapacity = 0; // force the row capacity (tests of long rows)
  // Where rows are parsed: -1 on the sort's threads, +1 on a thread of
  // their own, 0 chosen by the machine (RecordPipeline.h).
  int parseThread = 0;
};

bool ParseSortOptions(const std::vector<std::string>& args, SortOptions* o) {
  ArgParser parser(args,
                   {{"key", 'k', true, kKey},
                    {"output", 'o', true, kOutput},
                    {"delimiter", 't', true, kDelimiter},
                    {"tsv", 0, false, kTsv},
                    {"no-header", 0, false, kNoHeader},
                    {"nvars", 0, true, kNvars},
                    {"memory", 'm', true, kMemory},
                    {"threads", 'j', true, kThreads},
                    {"tmpdir", 'T', true, kTmpdir},
                    {"quiet", 'q', false, kQuiet},
                    {"progress", 0, false, kProgress},
                    {"stats", 0, false, kStats},
                    {"help", 'h', false, kHelp},
                    {"pass-through", 0, false, kPassThrough},
                    {"row-capacity", 0, true, kRowCapacity},
                    {"serial-parse", 0, false, kSerialParse},
                    {"parse-thread", 0, false, kParseThread}},
                   "sort");
  int id;
  std::string value;
  bool haveInput = false;
  while (parser.Next(&id, &value)) {
    switch (id) {
      case ArgParser::kPositional:
        if (haveInput) throw UsageError("more than one input ('" + o->input + "' and '" + value + "'); the output goes with -o");
        o->input = value;
        haveInput = true;
        break;
      case kKey:
        o->keys.push_back(ParseKeySpec(value));
        break;
      case kOutput:
        o->output = value;
        break;
      case kDelimiter:
        if (value == "tab" || value == "\\t") value = "\t";
        if (value.size() != 1 || value[0] == '"' || value[0] == '\n' || value[0] == '\r') {
          throw UsageError("bad delimiter '" + value + "': one byte other than a quote or a line end");
        }
        o->format.delimiter = value[0];
        break;
      case kTsv:
        o->format.delimiter = '\t';
        o->format.quoting = false;
        break;
      case kNoHeader:
        o->header = false;
        break;
      case kNvars:
        o->nvars = static_cast<unsigned>(ParseCount(value, parser.Spelling(), 1, 1u << 24));
        break;
      case kMemory:
        o->memory = ParseSize(value, parser.Spelling());
        break;
      case kThreads:
        o->threads = static_cast<unsigned>(ParseCount(value, parser.Spelling(), 1, 1024));
        break;
      case kTmpdir:
        if (value.empty()) throw UsageError("option '" + parser.Spelling() + "' needs a directory");
        o->tmpdir = value;
        break;
      case kQuiet:
        o->quiet = true;
        break;
      case kProgress:
        o->progress = true;
        break;
      case kStats:
        o->stats = true;
        break;
      case kHelp:
        std::fputs(kSortHelp, stdout);
        return false;
      case kPassThrough:
        o->passThrough = true;
        break;
      case kSerialParse:
        o->parseThread = -1;
        break;
      case kParseThread:
        o->parseThread = 1;
        break;
      case kRowCapacity:
        o->rowCapacity = static_cast<std::uint32_t>(ParseCount(value, parser.Spelling(), 8, 1u << 20) + 7) / 8 * 8;
        break;
    }
  }
  if (o->keys.empty() && !o->passThrough) {
    throw UsageError("no sort key: give at least one -k COLUMN[:n|:sW][:asc|:desc] (see 'isort sort --help')");
  }
  return true;
}

typedef std::chrono::steady_clock Clock;
double Since(Clock::time_point start) {
  return std::chrono::duration<double>(Clock::now() - start).count();
}

// Header names as the keys match them: quotes removed, and a byte order
// mark before the first name ignored.
std::vector<std::string> HeaderNames(const CsvRow& row) {
  std::vector<std::string> names;
  std::string scratch;
  for (unsigned i = 0; i < row.fieldCount; ++i) {
    std::size_t size;
    const char* text = FieldValue(row.fields[i], scratch, &size);
    names.emplace_back(text, size);
  }
  if (!names.empty() && names[0].compare(0, 3, "\xEF\xBB\xBF") == 0) names[0].erase(0, 3);
  return names;
}

struct Run {
  const SortOptions& options;
  std::string tmpdir;
  Progress progress;
  FileSort::Statistics stats;
  SortReport report;
  Clock::time_point start = Clock::now();

  Run(const SortOptions& o, bool showProgress) : options(o), progress(showProgress) {}

  std::uint32_t MemoryTarget() const {
    std::uint64_t m = options.memory;
    if (m > 0xFFFFFFFFull) m = 0xFFFFFFFFull;
    return static_cast<std::uint32_t>(m);
  }

  // The target the library will use: at least 100 MiB.
  std::uint64_t EffectiveTarget() const {
    const std::uint64_t minimum = 104857600;
    return options.memory > minimum ? MemoryTarget() : minimum;
  }

  void Configure(FileSort& sorter, std::int64_t rows) {
    if (options.memory != 0) sorter.SetMemoryTarget(MemoryTarget());
    if (rows >= 0) sorter.SetNRows(rows);
    report.memoryTarget = EffectiveTarget();
  }

  void SortBinary(FileHandle& input, OutputFile& output);
  void SortText(FileHandle& input, OutputFile& output);
  void PassThrough(FileHandle& input, OutputFile& output);
};

void Run::SortBinary(FileHandle& input, OutputFile& output) {
  const unsigned nvars = options.nvars;
  const std::uint64_t recordBytes = std::uint64_t{nvars} * 8;
  std::vector<KeySpec> keys = options.keys;
  ResolveValues(keys, nvars);
  const std::int64_t size = input.RegularSize();
  std::int64_t records = -1;
  if (size >= 0) {
    if (static_cast<std::uint64_t>(size) % recordBytes != 0) {
      throw DataError(input.Name() + ": " + std::to_string(size) + " bytes are not a whole number of " +
                      std::to_string(recordBytes) + "-byte records (" + std::to_string(nvars) + " values)");
    }
    records = static_cast<std::int64_t>(static_cast<std::uint64_t>(size) / recordBytes);
  }
  std::vector<FileSort::SortKey> sortKeys;
  for (const KeySpec& key : keys) {
    sortKeys.push_back(FileSort::SortKey{static_cast<std::int32_t>(key.index), key.direction,
                                         key.numeric ? 0u : key.width});
  }
  if (options.passThrough) {
    std::vector<char> buffer(std::size_t{1} << 20);
    std::size_t n;
    while ((n = input.Read(buffer.data(), buffer.size())) != 0) output.Write(buffer.data(), n);
    return;
  }
  BinarySorter sorter(sortKeys, nvars, &stats, input, output, progress,
                      records < 0 ? 0 : static_cast<std::uint64_t>(records));
  Configure(sorter, records);
  progress.Start("reading", records < 0 ? 0 : static_cast<std::uint64_t>(records), "records", 1u << 16);
  const Clock::time_point sortStart = Clock::now();
  sorter.Sort();
  report.sortSeconds = Since(sortStart);
  report.binary = true;
  report.nvars = nvars;
  report.keyValues = 0;
  for (const KeySpec& key : keys) report.keyValues += KeyStep(key);
  report.inputBytes = sorter.RecordsRead() * recordBytes;
}

void Run::PassThrough(FileHandle& input, OutputFile& output) {
  CsvReader reader(input, options.format);
  CsvRow row;
  std::vector<KeySpec> keys = options.keys;
  std::vector<std::string> names;
  bool crlf = false;
  RowWriter writer(output, crlf);
  bool endsWithTerminator = true;
  if (options.header) {
    if (!reader.Next(row, UINT_MAX)) return;
    names = HeaderNames(row);
    writer.WriteRow(row.data, row.size);
    endsWithTerminator = row.terminator != 0;
  }
  ResolveColumns(keys, options.header ? &names : nullptr);
  // The floor extracts the keys as the sort does; a string key without a
  // width gets a stand-in one (the sort would know it from its first pass).
  std::vector<KeySpec> narrow = keys;
  for (KeySpec& key : narrow) {
    if (!key.numeric && key.width == 0) key.width = 64;
  }
  KeyExtractor fit(narrow, input.Name());
  std::vector<OBS> values(fit.KeyValues() + 1);
  while (reader.Next(row, fit.FieldsWanted())) {
    try {
      fit.Extract(row, values.data());
    } catch (const DataError&) {
      // A value wider than the stand-in width: the floor does not care.
    }
    writer.WriteRow(row.data, row.size);
    endsWithTerminator = row.terminator != 0;
  }
  writer.Finish(endsWithTerminator);
}

void Run::SortText(FileHandle& input, OutputFile& output) {
  const CsvFormat& format = options.format;
  const bool seekable = input.RegularSize() >= 0;
  report.input = input.Name();

  // First pass: the header, then the rows' lengths, terminators and the
  // widths of the string keys given without one. Standard input is copied
  // to a nameless temporary file on the way, for the second pass.
  const Clock::time_point firstStart = Clock::now();
  FileHandle spool;
  if (!seekable) spool = FileHandle::CreateNameless(tmpdir, "copy of standard input");
  std::string header;
  unsigned headerTerminator = 0;
  std::vector<KeySpec> keys = options.keys;
  std::unique_ptr<CsvScanner> scanner;
  {
    CsvReader first(input, format);
    if (!seekable) first.SetCopy(&spool);
    CsvRow row;
    std::vector<std::string> names;
    if (options.header) {
      // An empty input has no header to name columns, and nothing to sort.
      if (!first.Next(row, UINT_MAX)) return;
      names = HeaderNames(row);
      header.assign(row.data, row.size);
      headerTerminator = row.terminator;
    }
    ResolveColumns(keys, options.header ? &names : nullptr);
    std::vector<unsigned> widthColumns;
    for (const KeySpec& key : keys) {
      if (!key.numeric && key.width == 0) widthColumns.push_back(key.index);
    }
    scanner.reset(new CsvScanner(format, widthColumns, first.NextLine(), input.Name()));
    const std::int64_t size = input.RegularSize();
    progress.Start("scanning", size > 0 ? static_cast<std::uint64_t>(size) : 0, "bytes", 1);
    scanner->Scan(first.Pending(), first.PendingBytes());
    std::uint64_t scanned = first.Consumed() + first.PendingBytes();
    if (!first.AtEnd()) {
      std::vector<char> block(std::size_t{1} << 20);
      for (;;) {
        const std::size_t n = input.Read(block.data(), block.size());
        if (n != 0 && !seekable) spool.WriteAll(block.data(), n);
        scanner->Scan(block.data(), n);
        scanned += n;
        progress.Update(scanned);
        if (n < block.size()) break;
      }
    }
    scanner->Finish();
    report.inputBytes = scanned;
    std::size_t w = 0;
    for (KeySpec& key : keys) {
      if (!key.numeric && key.width == 0) {
        const std::uint64_t widest = scanner->Width(w++);
        if (widest > 0x7FFFFFFF) throw DataError(input.Name() + ": " + key.label + " holds a value too wide to sort");
        key.width = widest == 0 ? 1 : static_cast<std::uint32_t>(widest);
      }
    }
  }
  report.firstPassSeconds = Since(firstStart);

  const std::uint64_t rows = scanner->Rows();
  const std::uint64_t crlf = scanner->CrlfRows() + (headerTerminator == 2);
  const std::uint64_t lf = scanner->LfRows() + (headerTerminator == 1);
  const bool endsWithTerminator = rows > 0 ? scanner->EndsWithTerminator()
                                           : (header.empty() || headerTerminator != 0);
  // Long rows stay in memory up to an eighth of the memory target (at least
  // 16 MiB): with the sort's own use that keeps the process within 1.25
  // times the target plus a little.
  const std::uint64_t sideMemory = std::max<std::uint64_t>(16u << 20, EffectiveTarget() / 8);
  std::uint32_t capacity = options.rowCapacity;
  if (capacity == 0) capacity = ChooseRowCapacity(scanner->Histogram(), rows, scanner->LongestRow(), sideMemory);
  const std::uint64_t longest = scanner->LongestRow() > header.size() ? scanner->LongestRow() : header.size();
  scanner.reset();

  // Second pass: the sort.
  FileHandle& source = seekable ? input : spool;
  source.Rewind();
  CsvReader reader(source, format, std::size_t{1} << 20, static_cast<std::size_t>(longest) + 1);
  CsvRow row;
  if (!header.empty()) reader.Next(row, 0);
  KeyExtractor extractor(keys, input.Name());
  SideFile side(tmpdir, static_cast<std::size_t>(sideMemory));
  RowWriter writer(output, crlf > lf);
  if (!header.empty()) writer.WriteRow(header.data(), header.size());
  // A parsing thread pays where the sort's workers leave cores idle while
  // one of them reads: with four hardware threads or more. On two, the two
  // workers keep both busy and a third thread only competes.
  const bool pipelined = options.parseThread > 0 || (options.parseThread == 0 && std::thread::hardware_concurrency() >= 4);
  CsvSorter sorter(extractor, capacity, &stats, reader, side, writer, progress, rows, pipelined);
  Configure(sorter, static_cast<std::int64_t>(rows));
  progress.Start("reading", rows, "rows", 1u << 16);
  const Clock::time_point sortStart = Clock::now();
  sorter.Sort();
  report.sortSeconds = Since(sortStart);
  writer.Finish(endsWithTerminator);

  report.nvars = CsvSorter::Nvars(extractor, capacity);
  report.keyValues = extractor.KeyValues();
  report.rowCapacity = capacity;
  report.sideRows = side.Rows();
  report.sideBytes = side.Bytes();
  report.unparsable = extractor.Unparsable();
}

}  // namespace

int SortCommand(const std::vector<std::string>& args) {
  SortOptions options;
  if (!ParseSortOptions(args, &options)) return kExitOk;
  if (options.threads != 0) vexahost::SetThreadSetting(options.threads);
  if (!options.tmpdir.empty()) vexahost::SetTempDirectory(options.tmpdir);

  const bool showProgress = !options.quiet && (options.progress || StandardErrorIsTerminal());
  Run run(options, showProgress);
  run.tmpdir = vexahost::TempDirectory();
  // Fail before any work when temporary files cannot be made.
  FileHandle::CreateNameless(run.tmpdir, "temporary file");

  FileHandle input = options.input == "-" ? FileHandle::StandardInput() : FileHandle::OpenRead(options.input);
  OutputFile output(options.output);
  run.report.input = input.Name();
  if (options.nvars != 0) {
    run.SortBinary(input, output);
  } else if (options.passThrough) {
    run.PassThrough(input, output);
  } else {
    run.SortText(input, output);
  }
  output.Commit();
  run.progress.Clear();
  run.report.totalSeconds = Since(run.start);
  if (options.stats && !options.passThrough) PrintStatistics(stderr, run.stats, run.report);
  return kExitOk;
}

}  // namespace isortcli

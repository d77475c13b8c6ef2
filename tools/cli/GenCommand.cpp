// isort gen: a sample table, deterministic for a seed.
//
// The text table is survey-like: case id; region, sex and education (short
// strings); age (an integer 18 to 90); income (two decimals, about 5%
// missing, written as empty fields); weight (a double); satisfaction (1 to
// 5, about 3% missing); and a free-text comment, mostly empty, sometimes
// holding commas, quotes or a line break, and then quoted.
//
// Binary records hold N raw 8-byte values: the case id, an 8-byte region
// name (blank-padded text), the age, the income or the system-missing
// value, then uniform doubles.
#include <charconv>
#include <cstdio>
#include <cstring>
#include <string>

#include "ArgParser.h"
#include "Commands.h"
#include "CsvWriter.h"
#include "Errors.h"
#include "OutputFile.h"
#include "Random.h"
#include "host/hostsettings.h"

namespace isortcli {
namespace {

const char kGenHelp[] =
    "usage: isort gen [options] [-o OUTPUT]\n"
    "\n"
    "Writes a sample table, the same for the same seed.\n"
    "\n"
    "  --rows N        rows (records) to write (default 1000; 10M, 2k allowed)\n"
    "  --seed S        seed of the generator (default 1)\n"
    "  -o, --output F  output file (default: standard output)\n"
    "  --crlf          end the text rows with CR LF\n"
    "  --no-header     no header row\n"
    "  --binary        binary records instead of CSV\n"
    "  --nvars N       values per binary record (default 8)\n";

const char* const kRegions[] = {"North", "South", "East", "West", "Central", "Highlands",
                                "Coast", "Islands", "Metro", "Valley", "Plains", "Delta"};
const char* const kEducation[] = {"primary", "secondary", "vocational", "bachelor", "master", "doctorate"};
const char* const kWords[] = {"good", "service", "slow", "friendly", "price", "quality", "waiting",
                              "staff", "clean", "late", "helpful", "expensive", "fine", "never"};

void AppendInt(std::string& line, long long v) {
  char text[24];
  const std::to_chars_result r = std::to_chars(text, text + sizeof text, v);
  line.append(text, r.ptr);
}

// A fixed-point number with `decimals` digits after the point.
void AppendFixed(std::string& line, long long scaled, int decimals) {
  if (scaled < 0) {
    line.push_back('-');
    scaled = -scaled;
  }
  long long unit = 1;
  for (int i = 0; i < decimals; ++i) unit *= 10;
  AppendInt(line, scaled / unit);
  line.push_back('.');
  char digits[24];
  long long frac = scaled % unit;
  for (int i = decimals - 1; i >= 0; --i) {
    digits[i] = static_cast<char>('0' + frac % 10);
    frac /= 10;
  }
  line.append(digits, static_cast<std::size_t>(decimals));
}

void Comment(sortbench::Random& rng, std::string& text) {
  text.clear();
  const std::uint32_t kind = rng.Below(100);
  if (kind < 70) return;
  const std::uint32_t words = 1 + rng.Below(6);
  for (std::uint32_t w = 0; w < words; ++w) {
    if (w != 0) text.push_back(' ');
    text += kWords[rng.Below(sizeof kWords / sizeof kWords[0])];
  }
  if (kind < 78) {
    text += ", but " + std::string(kWords[rng.Below(sizeof kWords / sizeof kWords[0])]);
  } else if (kind < 81) {
    text = "said \"" + text + "\"";
  } else if (kind == 81) {
    text += "\nsecond line";
  }
}

void WriteText(OutputFile& out, std::uint64_t rows, std::uint64_t seed, bool crlf, bool header) {
  const char* eol = crlf ? "\r\n" : "\n";
  std::string line;
  if (header) {
    line = "id,region,sex,age,education,income,weight,satisfaction,comment";
    line += eol;
    out.Write(line.data(), line.size());
  }
  sortbench::Random rng(seed);
  std::string comment;
  for (std::uint64_t i = 0; i < rows; ++i) {
    line.clear();
    AppendInt(line, static_cast<long long>(i + 1));
    line.push_back(',');
    line += kRegions[rng.Below(12)];
    line.push_back(',');
    line.push_back(rng.Below(2) ? 'F' : 'M');
    line.push_back(',');
    AppendInt(line, 18 + rng.Below(73));
    line.push_back(',');
    line += kEducation[rng.Below(6)];
    line.push_back(',');
    if (rng.Below(100) >= 5) AppendFixed(line, 500000 + static_cast<long long>(rng.Below(15000000)), 2);
    line.push_back(',');
    AppendFixed(line, 2000 + rng.Below(28000), 4);
    line.push_back(',');
    if (rng.Below(100) >= 3) AppendInt(line, 1 + rng.Below(5));
    line.push_back(',');
    Comment(rng, comment);
    AppendField(line, comment.data(), comment.size(), ',');
    line += eol;
    out.Write(line.data(), line.size());
  }
}

void WriteBinary(OutputFile& out, std::uint64_t rows, std::uint64_t seed, unsigned nvars) {
  sortbench::Random rng(seed);
  std::vector<OBS> record(nvars);
  OBS missing;
  std::memcpy(&missing, vexahost::SystemMissing(), sizeof missing);
  for (std::uint64_t i = 0; i < rows; ++i) {
    for (unsigned v = 0; v < nvars; ++v) {
      double d = 0;
      switch (v) {
        case 0:
          d = static_cast<double>(i + 1);
          break;
        case 1: {
          char name[8];
          std::memset(name, ' ', sizeof name);
          const char* region = kRegions[rng.Below(12)];
          std::memcpy(name, region, std::strlen(region) < 8 ? std::strlen(region) : 8);
          std::memcpy(&record[v], name, sizeof name);
          continue;
        }
        case 2:
          d = 18 + rng.Below(73);
          break;
        case 3:
          if (rng.Below(100) < 5) {
            record[v] = missing;
            continue;
          }
          d = 5000 + rng.Below(15000000) / 100.0;
          break;
        default:
          d = rng.Unit() * 1000.0;
      }
      std::memcpy(&record[v], &d, sizeof d);
    }
    out.Write(record.data(), record.size() * sizeof(OBS));
  }
}

}  // namespace

int GenCommand(const std::vector<std::string>& args) {
  enum { kRows = 1, kSeed, kOutput, kCrlf, kNoHeader, kBinary, kNvars, kHelp };
  ArgParser parser(args,
                   {{"rows", 0, true, kRows},
                    {"seed", 0, true, kSeed},
                    {"output", 'o', true, kOutput},
                    {"crlf", 0, false, kCrlf},
                    {"no-header", 0, false, kNoHeader},
                    {"binary", 0, false, kBinary},
                    {"nvars", 0, true, kNvars},
                    {"help", 'h', false, kHelp}},
                   "gen");
  std::uint64_t rows = 1000, seed = 1;
  unsigned nvars = 8;
  std::string output = "-";
  bool crlf = false, header = true, binary = false;
  int id;
  std::string value;
  while (parser.Next(&id, &value)) {
    switch (id) {
      case ArgParser::kPositional:
        throw UsageError("unexpected argument '" + value + "' (the output goes with -o)");
      case kRows:
        rows = ParseCount(value, parser.Spelling(), 0, UINT64_MAX / 2);
        break;
      case kSeed:
        seed = ParseCount(value, parser.Spelling(), 0, UINT64_MAX / 2);
        break;
      case kOutput:
        output = value;
        break;
      case kCrlf:
        crlf = true;
        break;
      case kNoHeader:
        header = false;
        break;
      case kBinary:
        binary = true;
        break;
      case kNvars:
        nvars = static_cast<unsigned>(ParseCount(value, parser.Spelling(), 1, 1u << 24));
        break;
      case kHelp:
        std::fputs(kGenHelp, stdout);
        return kExitOk;
    }
  }
  OutputFile out(output);
  if (binary) {
    WriteBinary(out, rows, seed, nvars);
  } else {
    WriteText(out, rows, seed, crlf, header);
  }
  out.Commit();
  return kExitOk;
}

}  // namespace isortcli

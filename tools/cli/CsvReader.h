// Reading delimited text: RFC 4180 CSV (fields in double quotes may hold the
// delimiter, doubled quotes and line breaks) or, with quoting off, plain
// delimited text such as TSV, where quotes are ordinary bytes.
//
// Rows end at a line feed; a carriage return just before it belongs to the
// terminator ("\r\n"), a lone carriage return is data. The last row may lack
// a terminator. A quote opens a quoted field only as the field's first byte;
// bytes after the closing quote, up to the delimiter, still belong to the
// field ("ab"cd reads as abcd), and a quote inside an unquoted field is data.
//
// Two readers share these rules. CsvReader hands out whole rows from a
// buffer that grows to the longest row; CsvScanner walks blocks of any size
// without keeping rows, for the first pass over an input of unknown shape.
#pragma once

#include <cstddef>
#include <cstdint>
#include <string>
#include <vector>

#include "SysIo.h"

namespace isortcli {

struct CsvFormat {
  char delimiter = ',';
  bool quoting = true;  // false: quotes are data (TSV)
};

// One field as it stands in the input.
struct FieldRef {
  const char* data = nullptr;  // first byte; the opening quote of a quoted field
  std::uint32_t size = 0;      // bytes up to the delimiter or terminator
  bool quoted = false;         // starts with a quote (quoting on)
};

// One row: its bytes as they stand, terminator included, and its first fields.
struct CsvRow {
  const char* data = nullptr;  // valid until the reader's next call
  std::size_t size = 0;
  unsigned terminator = 0;     // bytes of the terminator: 0 (none), 1 ("\n") or 2 ("\r\n")
  std::uint64_t line = 0;      // the 1-based line on which the row starts
  std::uint32_t lines = 0;     // line feeds the row holds, terminator included
  unsigned fieldCount = 0;     // fields split (at most the number asked for)
  std::vector<FieldRef> fields;  // fields[0 .. fieldCount)
};

// A field's value: quotes removed and doubled quotes collapsed. `scratch`
// holds the result when it differs from the input bytes; the returned
// pointer is valid while both the row and `scratch` are.
const char* FieldValue(const FieldRef& field, std::string& scratch, std::size_t* size);
// The length of FieldValue's result without building it.
std::size_t FieldValueSize(const FieldRef& field);

// Rows from a file, read in large blocks into one buffer.
class CsvReader {
 public:
  // The reader does not own `input`. Rows longer than `maxRowBytes` are an
  // error (they would have to be held whole).
  CsvReader(FileHandle& input, const CsvFormat& format, std::size_t blockBytes = 1u << 20,
            std::size_t maxRowBytes = std::size_t{1} << 30);

  // Reads the next row and splits at least its first `wanted` fields (all of
  // them when it has fewer). Returns false at the end of the input.
  // Throws DataError on an unterminated quote (naming its line) and on
  // input errors.
  bool Next(CsvRow& row, unsigned wanted);

  // Bytes buffered but not yet handed out, and the line the next row starts
  // on: what a scanner needs to continue where this reader stopped.
  const char* Pending() const { return cur_; }
  std::size_t PendingBytes() const { return static_cast<std::size_t>(end_ - cur_); }
  bool AtEnd() const { return eof_; }
  std::uint64_t NextLine() const { return line_; }
  // Bytes consumed from the input so far (rows handed out).
  std::uint64_t Consumed() const { return consumed_; }
  // Every block read is also written here (to keep standard input for a
  // second pass). Not owned; may be null.
  void SetCopy(FileHandle* copy) { copy_ = copy; }

 private:
  enum class Parse { Row, NeedMore };
  Parse ParseRow(const char* begin, unsigned wanted, CsvRow& row);
  void Refill();
  [[noreturn]] void Unterminated(const char* rowBegin, const char* quote, std::uint64_t line);

  FileHandle& input_;
  CsvFormat format_;
  std::size_t block_;
  std::size_t maxRow_;
  std::vector<char> buffer_;
  char* cur_;
  char* end_;
  bool eof_ = false;
  std::uint64_t line_ = 1;
  std::uint64_t consumed_ = 0;
  FileHandle* copy_ = nullptr;
};

// A streaming pass over delimited text that measures it: rows, the longest
// row, a histogram of row lengths, terminators, and the widest value of the
// chosen columns. Holds no row; blocks may cut rows anywhere.
class CsvScanner {
 public:
  // `widthColumns`: 0-based columns whose widest value (quotes removed) is
  // wanted. `firstLine`: the line number of the first byte scanned.
  CsvScanner(const CsvFormat& format, const std::vector<unsigned>& widthColumns,
             std::uint64_t firstLine, std::string inputName);

  // Scans the next block of input.
  void Scan(const char* data, std::size_t bytes);
  // Ends the input. Throws DataError on an unterminated quote.
  void Finish();

  // Row lengths are kept in steps of 8 bytes up to this length; longer rows
  // are counted in one bucket.
  static constexpr std::uint64_t kHistogramLimit = std::uint64_t{1} << 19;

  std::uint64_t Rows() const { return rows_; }
  std::uint64_t LongestRow() const { return longest_; }
  // Rows by length: [k] counts rows of 8k-7 .. 8k bytes ([0]: empty rows
  // cannot occur; the last bucket: longer than kHistogramLimit).
  const std::vector<std::uint64_t>& Histogram() const { return histogram_; }
  std::uint64_t CrlfRows() const { return crlf_; }
  std::uint64_t LfRows() const { return lf_; }
  // The input ended with a terminator (true for empty input too).
  bool EndsWithTerminator() const { return endsWithTerminator_; }
  // The widest value of widthColumns[i], in bytes.
  std::uint64_t Width(std::size_t i) const;

 private:
  void EndField();
  void EndRow(std::uint64_t end, unsigned terminator);

  CsvFormat format_;
  std::string inputName_;
  std::vector<int> widthSlot_;  // column -> index into widths_, -1 if unwanted
  std::vector<int> positionSlot_;  // widthColumns[i] -> index into widths_
  std::vector<std::uint64_t> widths_;
  unsigned wanted_;            // columns that need the field-by-field walk

  std::uint64_t offset_ = 0;   // bytes scanned
  std::uint64_t rowStart_ = 0;
  std::uint64_t line_;
  std::uint64_t quoteLine_ = 0;
  std::uint64_t fieldSize_ = 0;
  unsigned field_ = 0;
  bool fieldStart_ = true;
  bool inQuotes_ = false;
  bool quotePending_ = false;  // a quote inside quotes ended the last block
  bool slowRow_ = false;       // a quote past the wanted columns: walk byte by byte
  char last_ = 0;              // the last byte scanned outside quotes

  std::uint64_t rows_ = 0;
  std::uint64_t longest_ = 0;
  std::vector<std::uint64_t> histogram_;
  std::uint64_t crlf_ = 0;
  std::uint64_t lf_ = 0;
  bool endsWithTerminator_ = true;
};

}  // namespace isortcli

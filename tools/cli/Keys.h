// Sort keys of the command line: their syntax, the columns they name, and
// their values as the sort library compares them.
//
// A key is COLUMN[:TYPE][:ORDER]. COLUMN is a header name or a 1-based
// column number (for binary records, a 1-based value number). TYPE is "n"
// (numeric) or "sW" (a string of W bytes; "s" alone: as wide as the column's
// widest value); the default is "s". ORDER is "asc" (default) or "desc".
//
// Numeric values are read without regard to the locale; surrounding blanks
// and a leading '+' are allowed. An empty field, text that is not a number,
// a NaN and a number out of range all become the system-missing value, which
// sorts below every number; -inf sorts with it. A string value is its bytes (quotes removed),
// padded with 0 bytes to W, so it sorts before its own extensions; a value
// longer than W is an error.
#pragma once

#include <cstdint>
#include <string>
#include <vector>

#include "CsvReader.h"
#include "isort/FileSort.h"

namespace isortcli {

struct KeySpec {
  std::string text;      // as given, for messages
  std::string column;    // header name or 1-based number, as given
  bool numeric = false;
  std::uint32_t width = 0;  // string keys: bytes; 0 = the widest value (found by a first pass)
  int direction = 1;     // +1 ascending, -1 descending
  unsigned index = 0;    // resolved: 0-based column (binary: value)
  std::string label;     // resolved: "column 3 (income)", for messages
};

// Parses one -k argument. Throws UsageError.
KeySpec ParseKeySpec(const std::string& text);

// Resolves each key's column against the header's names (null: no header).
// A name matches before a number does. Throws UsageError for a column the
// input does not have.
void ResolveColumns(std::vector<KeySpec>& keys, const std::vector<std::string>* header);

// Resolves keys against binary records of `nvars` values: columns are value
// numbers; "s" alone means 8 bytes. Throws UsageError for a key that does
// not fit the record.
void ResolveValues(std::vector<KeySpec>& keys, unsigned nvars);

// Values a key takes in a record: one for a number, (W + 7) / 8 for a string.
unsigned KeyStep(const KeySpec& key);

// Turns the key fields of CSV rows into the key values at the front of a
// sort record: each key in its own slot, in key order.
class KeyExtractor {
 public:
  // Keys must be resolved and every string key's width known.
  KeyExtractor(const std::vector<KeySpec>& keys, std::string inputName);

  // Fields a row must be split into: the highest key column + 1.
  unsigned FieldsWanted() const { return wanted_; }
  // Values the keys take at the front of the record.
  unsigned KeyValues() const { return values_; }
  // The keys as the sort library takes them, slots from value 0 on.
  std::vector<FileSort::SortKey> SortKeys() const;

  // Writes the key values of `row` to values[0 .. KeyValues()). Throws
  // DataError for a string wider than its key's width.
  void Extract(const CsvRow& row, OBS* values);

  // Non-empty numeric key fields that were not numbers (they became missing).
  std::uint64_t Unparsable() const { return unparsable_; }

 private:
  struct Slot {
    unsigned column;
    unsigned first;     // first value in the record
    std::uint32_t width;  // 0 numeric
    std::size_t key;    // index into keys_, for messages
  };
  [[noreturn]] void TooWide(const CsvRow& row, const Slot& slot, std::size_t size) const;

  std::vector<KeySpec> keys_;
  std::string inputName_;
  std::vector<Slot> slots_;
  unsigned wanted_ = 0;
  unsigned values_ = 0;
  std::string scratch_;
  std::uint64_t unparsable_ = 0;
  OBS missing_;
};

// Parses a number as the keys do; false (and *value untouched) for an
// empty field or one that is not a number.
bool ParseNumber(const char* text, std::size_t size, double* value, bool* empty);

}  // namespace isortcli

// The tool's CSV reader and scanner on tricky input: randomised round trips
// through the writer, read back in blocks of every small size.
#include <algorithm>
#include <cstdio>
#include <random>
#include <string>
#include <vector>

#include <gtest/gtest.h>

#include "CsvReader.h"
#include "CsvWriter.h"
#include "Errors.h"
#include "SysIo.h"
#include "host/hostsettings.h"

namespace isortcli {
namespace {

struct Expected {
  std::vector<std::string> fields;
  std::string raw;
  unsigned terminator;  // 0 none, 1 LF, 2 CRLF
  std::uint64_t line;
};

// Rows of random fields built from bytes that matter to the format.
std::vector<Expected> RandomRows(std::mt19937_64& rng, char delimiter, bool quoting, std::string* text) {
  static const char alphabet[] = {'a', 'b', ' ', '"', '\n', '\r', ',', ';', '\t', 'x'};
  std::vector<Expected> rows;
  std::uint64_t line = 1;
  const unsigned count = static_cast<unsigned>(rng() % 40);
  for (unsigned r = 0; r < count; ++r) {
    Expected e;
    const unsigned fields = 1 + static_cast<unsigned>(rng() % 6);
    for (unsigned f = 0; f < fields; ++f) {
      std::string value;
      for (unsigned n = static_cast<unsigned>(rng() % 7); n > 0; --n) {
        const char c = alphabet[rng() % sizeof alphabet];
        // Without quoting a field cannot hold the delimiter or a line end.
        value.push_back(!quoting && (c == delimiter || c == '\n' || c == '\r') ? 'q' : c);
      }
      if (!quoting && value.empty() && fields == 1) value = "e";
      e.fields.push_back(value);
      if (f) e.raw.push_back(delimiter);
      if (quoting) {
        AppendField(e.raw, value.data(), value.size(), delimiter);
      } else {
        e.raw += value;
      }
    }
    e.terminator = r + 1 == count && rng() % 2 ? 0 : (rng() % 2 ? 2 : 1);
    // A lone empty field with no terminator would be no row at all.
    if (e.terminator == 0 && e.raw.empty()) e.terminator = 1;
    e.raw += e.terminator == 2 ? "\r\n" : e.terminator == 1 ? "\n" : "";
    e.line = line;
    for (char c : e.raw) line += c == '\n';
    *text += e.raw;
    rows.push_back(e);
  }
  return rows;
}

FileHandle TextFile(const std::string& text) {
  FileHandle handle = FileHandle::CreateNameless(vexahost::TempDirectory(), "test file");
  handle.WriteAll(text.data(), text.size());
  handle.Rewind();
  return handle;
}

std::string Value(const FieldRef& field) {
  std::string scratch;
  std::size_t size;
  const char* value = FieldValue(field, scratch, &size);
  EXPECT_EQ(FieldValueSize(field), size);
  return std::string(value, size);
}

// Each random text read back in blocks of a random size, and measured by the
// scanner fed in random pieces (empty ones included).
TEST(CsvReader, RandomRowsReadBackInAnyBlockSizeAndMeasured) {
  const std::uint64_t seed = std::random_device{}();
  std::printf("seed %llu\n", static_cast<unsigned long long>(seed));
  std::mt19937_64 rng(seed);
  for (int iteration = 0; iteration < 300; ++iteration) {
    const bool quoting = iteration % 3 != 2;
    const char delimiter = iteration % 2 ? ',' : (quoting ? ';' : '\t');
    const CsvFormat format{delimiter, quoting};
    std::string text;
    const std::vector<Expected> rows = RandomRows(rng, delimiter, quoting, &text);
    const std::size_t block = 1 + rng() % 64;
    const unsigned wanted = static_cast<unsigned>(rng() % 8);
    SCOPED_TRACE("seed " + std::to_string(seed) + " iteration " + std::to_string(iteration) + " block " +
                 std::to_string(block) + " wanted " + std::to_string(wanted));
    FileHandle file = TextFile(text);
    CsvReader reader(file, format, block);
    CsvRow row;
    const std::vector<unsigned> columns = {0, 2, 2};
    std::uint64_t longest = 0, crlf = 0, lf = 0, widths[3] = {0, 0, 0};
    for (const Expected& e : rows) {
      ASSERT_TRUE(reader.Next(row, wanted));
      ASSERT_EQ(std::string(row.data, row.size), e.raw);
      EXPECT_EQ(row.terminator, e.terminator);
      EXPECT_EQ(row.line, e.line);
      ASSERT_EQ(row.fieldCount, std::min<std::size_t>(wanted, e.fields.size()));
      for (unsigned f = 0; f < row.fieldCount; ++f) EXPECT_EQ(Value(row.fields[f]), e.fields[f]) << "field " << f;
      longest = std::max<std::uint64_t>(longest, e.raw.size());
      crlf += e.terminator == 2;
      lf += e.terminator == 1;
      for (std::size_t i = 0; i < columns.size(); ++i) {
        if (columns[i] < e.fields.size()) widths[i] = std::max<std::uint64_t>(widths[i], e.fields[columns[i]].size());
      }
    }
    EXPECT_FALSE(reader.Next(row, wanted));
    EXPECT_EQ(reader.Consumed(), text.size());

    CsvScanner scanner(format, columns, 1, "sample");
    for (std::size_t at = 0, n; at < text.size(); at += n) {
      n = std::min<std::size_t>(rng() % 9, text.size() - at);
      scanner.Scan(text.data() + at, n);
    }
    scanner.Finish();
    EXPECT_EQ(scanner.Rows(), rows.size());
    EXPECT_EQ(scanner.LongestRow(), longest);
    EXPECT_EQ(scanner.CrlfRows(), crlf);
    EXPECT_EQ(scanner.LfRows(), lf);
    EXPECT_EQ(scanner.EndsWithTerminator(), rows.empty() || rows.back().terminator != 0);
    for (std::size_t i = 0; i < columns.size(); ++i) EXPECT_EQ(scanner.Width(i), widths[i]) << "column " << columns[i];
    std::uint64_t histogramRows = 0;
    for (std::uint64_t n : scanner.Histogram()) histogramRows += n;
    EXPECT_EQ(histogramRows, rows.size());
  }
}

TEST(CsvReader, UnterminatedQuoteNamesItsLine) {
  const std::string text = "a,b\n1,\"two\nlines\"\n3,\"open\n4,5\n";
  for (std::size_t block : {1u, 3u, 1024u}) {
    FileHandle file = TextFile(text);
    CsvReader reader(file, CsvFormat(), block);
    CsvRow row;
    ASSERT_TRUE(reader.Next(row, 2));
    ASSERT_TRUE(reader.Next(row, 2));
    EXPECT_EQ(row.lines, 2u);
    try {
      reader.Next(row, 2);
      ADD_FAILURE() << "no error";
    } catch (const DataError& e) {
      EXPECT_NE(std::string(e.what()).find("line 4: unterminated quote"), std::string::npos) << e.what();
    }
  }
  CsvScanner scanner(CsvFormat(), {}, 1, "input");
  scanner.Scan(text.data(), text.size());
  try {
    scanner.Finish();
    ADD_FAILURE() << "no error";
  } catch (const DataError& e) {
    EXPECT_STREQ(e.what(), "input: line 4: unterminated quote: the quoted field that starts here never ends");
  }
}

// Rows no writer makes: quotes inside or after a field's text, and carriage
// returns that do not end a line (they are data).
TEST(CsvReader, IrregularFieldsAndLoneCarriageReturns) {
  const struct {
    std::string text;
    std::vector<std::string> fields;
    unsigned terminator;
  } cases[] = {{"\"ab\"cd,z\r\n", {"abcd", "z"}, 2},  {"ab\"c,z\n", {"ab\"c", "z"}, 1},
               {"\"\",z", {"", "z"}, 0},              {"\"\"\"\",z\r\n", {"\"", "z"}, 2},
               {"\"a\"\"b\",z\r\n", {"a\"b", "z"}, 2}, {"x\"\",z\r\n", {"x\"\"", "z"}, 2},
               {"\"a,b\",z\r\n", {"a,b", "z"}, 2},    {"a\rb,c\r\r\n", {"a\rb", "c\r"}, 2}};
  for (const auto& c : cases) {
    SCOPED_TRACE(c.text);
    FileHandle file = TextFile(c.text);
    CsvReader reader(file, CsvFormat());
    CsvRow row;
    ASSERT_TRUE(reader.Next(row, 2));
    EXPECT_EQ(row.terminator, c.terminator);
    ASSERT_EQ(row.fieldCount, 2u);
    for (unsigned f = 0; f < 2; ++f) EXPECT_EQ(Value(row.fields[f]), c.fields[f]);
    EXPECT_FALSE(reader.Next(row, 2));
  }
}

TEST(CsvReader, RowsLongerThanTheLimitAreAnError) {
  FileHandle file = TextFile("short\n" + std::string(5000, 'x') + "\n");
  CsvReader reader(file, CsvFormat(), 64, 1000);
  CsvRow row;
  ASSERT_TRUE(reader.Next(row, 1));
  EXPECT_THROW(reader.Next(row, 1), DataError);
}

}  // namespace
}  // namespace isortcli

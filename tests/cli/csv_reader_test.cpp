// The tool's CSV reader and scanner on tricky input: randomised round trips
// through the writer, read back in blocks of every small size.
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
  unsigned terminator;
  std::uint64_t line;
};

struct Sample {
  std::string text;
  std::vector<Expected> rows;
};

// Rows of random fields built from bytes that matter to the format.
Sample RandomSample(std::mt19937_64& rng, char delimiter, bool quoting) {
  static const char alphabet[] = {'a', 'b', ' ', '"', '\n', '\r', ',', ';', '\t', 'x'};
  Sample s;
  std::uint64_t line = 1;
  const unsigned rows = static_cast<unsigned>(rng() % 40);
  for (unsigned r = 0; r < rows; ++r) {
    Expected e;
    const unsigned fields = 1 + static_cast<unsigned>(rng() % 6);
    for (unsigned f = 0; f < fields; ++f) {
      std::string value;
      const unsigned n = static_cast<unsigned>(rng() % 7);
      for (unsigned i = 0; i < n; ++i) {
        char c = alphabet[rng() % sizeof alphabet];
        // Without quoting a field cannot hold the delimiter or a line end.
        if (!quoting && (c == delimiter || c == '\n' || c == '\r')) c = 'q';
        value.push_back(c);
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
    const bool last = r + 1 == rows;
    e.terminator = last && rng() % 2 ? 0 : (rng() % 2 ? 2 : 1);
    // A lone empty field with no terminator would be no row at all.
    if (e.terminator == 0 && e.raw.empty()) e.terminator = 1;
    e.raw += e.terminator == 2 ? "\r\n" : e.terminator == 1 ? "\n" : "";
    e.line = line;
    for (char c : e.raw) line += c == '\n';
    s.text += e.raw;
    s.rows.push_back(e);
  }
  return s;
}

class CsvFile {
 public:
  explicit CsvFile(const std::string& text)
      : handle_(FileHandle::CreateNameless(vexahost::TempDirectory(), "test file")) {
    handle_.WriteAll(text.data(), text.size());
    handle_.Rewind();
  }
  FileHandle& Handle() { return handle_; }

 private:
  FileHandle handle_;
};

TEST(CsvReader, RandomRowsReadBackInAnyBlockSize) {
  const std::uint64_t seed = std::random_device{}();
  std::printf("seed %llu\n", static_cast<unsigned long long>(seed));
  std::mt19937_64 rng(seed);
  for (int iteration = 0; iteration < 300; ++iteration) {
    const bool quoting = iteration % 3 != 2;
    const char delimiter = iteration % 2 ? ',' : (quoting ? ';' : '\t');
    const Sample sample = RandomSample(rng, delimiter, quoting);
    const std::size_t block = 1 + rng() % 64;
    const unsigned wanted = static_cast<unsigned>(rng() % 8);
    SCOPED_TRACE("seed " + std::to_string(seed) + " iteration " + std::to_string(iteration) + " block " +
                 std::to_string(block) + " wanted " + std::to_string(wanted));
    CsvFile file(sample.text);
    CsvFormat format;
    format.delimiter = delimiter;
    format.quoting = quoting;
    CsvReader reader(file.Handle(), format, block);
    CsvRow row;
    std::string scratch;
    for (const Expected& e : sample.rows) {
      ASSERT_TRUE(reader.Next(row, wanted));
      ASSERT_EQ(std::string(row.data, row.size), e.raw);
      EXPECT_EQ(row.terminator, e.terminator);
      EXPECT_EQ(row.line, e.line);
      ASSERT_EQ(row.fieldCount, std::min<std::size_t>(wanted, e.fields.size()));
      for (unsigned f = 0; f < row.fieldCount; ++f) {
        std::size_t size;
        const char* value = FieldValue(row.fields[f], scratch, &size);
        EXPECT_EQ(std::string(value, size), e.fields[f]) << "field " << f;
        EXPECT_EQ(FieldValueSize(row.fields[f]), e.fields[f].size());
      }
    }
    EXPECT_FALSE(reader.Next(row, wanted));
    EXPECT_EQ(reader.Consumed(), sample.text.size());
  }
}

TEST(CsvScanner, MeasuresRandomRowsCutAnywhere) {
  const std::uint64_t seed = std::random_device{}();
  std::printf("seed %llu\n", static_cast<unsigned long long>(seed));
  std::mt19937_64 rng(seed);
  for (int iteration = 0; iteration < 300; ++iteration) {
    const bool quoting = iteration % 3 != 2;
    const char delimiter = quoting ? ',' : '\t';
    const Sample sample = RandomSample(rng, delimiter, quoting);
    SCOPED_TRACE("seed " + std::to_string(seed) + " iteration " + std::to_string(iteration));
    CsvFormat format;
    format.delimiter = delimiter;
    format.quoting = quoting;
    const std::vector<unsigned> columns = {0, 2, 2};
    CsvScanner scanner(format, columns, 1, "sample");
    // Feed the text in random pieces, empty ones included.
    std::size_t at = 0;
    while (at < sample.text.size()) {
      const std::size_t n = std::min<std::size_t>(rng() % 9, sample.text.size() - at);
      scanner.Scan(sample.text.data() + at, n);
      at += n;
    }
    scanner.Finish();
    std::uint64_t longest = 0, crlf = 0, lf = 0;
    std::uint64_t widths[3] = {0, 0, 0};
    for (const Expected& e : sample.rows) {
      longest = std::max<std::uint64_t>(longest, e.raw.size());
      crlf += e.terminator == 2;
      lf += e.terminator == 1;
      for (std::size_t i = 0; i < columns.size(); ++i) {
        if (columns[i] < e.fields.size()) widths[i] = std::max<std::uint64_t>(widths[i], e.fields[columns[i]].size());
      }
    }
    EXPECT_EQ(scanner.Rows(), sample.rows.size());
    EXPECT_EQ(scanner.LongestRow(), longest);
    EXPECT_EQ(scanner.CrlfRows(), crlf);
    EXPECT_EQ(scanner.LfRows(), lf);
    EXPECT_EQ(scanner.EndsWithTerminator(), sample.rows.empty() || sample.rows.back().terminator != 0);
    for (std::size_t i = 0; i < columns.size(); ++i) EXPECT_EQ(scanner.Width(i), widths[i]) << "column " << columns[i];
    std::uint64_t histogramRows = 0;
    for (std::uint64_t n : scanner.Histogram()) histogramRows += n;
    EXPECT_EQ(histogramRows, sample.rows.size());
  }
}

TEST(CsvReader, UnterminatedQuoteNamesItsLine) {
  const std::string text = "a,b\n1,\"two\nlines\"\n3,\"open\n4,5\n";
  for (std::size_t block : {1u, 3u, 1024u}) {
    CsvFile file(text);
    CsvReader reader(file.Handle(), CsvFormat(), block);
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

TEST(CsvReader, FieldValuesOfIrregularFields) {
  struct Case {
    std::string raw;
    std::string value;
  } cases[] = {{"\"ab\"cd", "abcd"}, {"ab\"c", "ab\"c"}, {"\"\"", ""}, {"\"\"\"\"", "\""},
               {"\"a\"\"b\"", "a\"b"}, {"x\"\"", "x\"\""}, {"\"a,b\"", "a,b"}};
  for (const Case& c : cases) {
    CsvFile file(c.raw + ",z\r\n");
    CsvReader reader(file.Handle(), CsvFormat());
    CsvRow row;
    ASSERT_TRUE(reader.Next(row, 2));
    ASSERT_EQ(row.fieldCount, 2u);
    std::string scratch;
    std::size_t size;
    const char* value = FieldValue(row.fields[0], scratch, &size);
    EXPECT_EQ(std::string(value, size), c.value) << c.raw;
    EXPECT_EQ(FieldValueSize(row.fields[0]), c.value.size()) << c.raw;
    value = FieldValue(row.fields[1], scratch, &size);
    EXPECT_EQ(std::string(value, size), "z");  // the CR belongs to the terminator
  }
}

TEST(CsvReader, LoneCarriageReturnIsData) {
  CsvFile file("a\rb,c\r\r\n");
  CsvReader reader(file.Handle(), CsvFormat());
  CsvRow row;
  ASSERT_TRUE(reader.Next(row, 2));
  EXPECT_EQ(row.terminator, 2u);
  EXPECT_EQ(std::string(row.fields[0].data, row.fields[0].size), "a\rb");
  EXPECT_EQ(std::string(row.fields[1].data, row.fields[1].size), "c\r");
  EXPECT_FALSE(reader.Next(row, 2));
}

TEST(CsvReader, RowsLongerThanTheLimitAreAnError) {
  CsvFile file("short\n" + std::string(5000, 'x') + "\n");
  CsvReader reader(file.Handle(), CsvFormat(), 64, 1000);
  CsvRow row;
  ASSERT_TRUE(reader.Next(row, 1));
  EXPECT_THROW(reader.Next(row, 1), DataError);
}

}  // namespace
}  // namespace isortcli

#include "CsvReader.h"

#include <algorithm>
#include <cstring>

#include "Errors.h"

#if defined(__SSE2__)
#include <emmintrin.h>
#endif

namespace isortcli {
namespace {

// The first byte in [p, end) equal to `a` or `b`, or `end`. Sixteen bytes
// at a time where SSE2 is there: rows are short, so the branch that leaves
// a byte loop would mispredict once per field.
inline const char* FindEither(const char* p, const char* end, char a, char b) {
#if defined(__SSE2__)
  const __m128i va = _mm_set1_epi8(a);
  const __m128i vb = _mm_set1_epi8(b);
  while (end - p >= 16) {
    const __m128i x = _mm_loadu_si128(reinterpret_cast<const __m128i*>(p));
    const int mask = _mm_movemask_epi8(_mm_or_si128(_mm_cmpeq_epi8(x, va), _mm_cmpeq_epi8(x, vb)));
    if (mask != 0) return p + __builtin_ctz(static_cast<unsigned>(mask));
    p += 16;
  }
#endif
  while (p < end && *p != a && *p != b) ++p;
  return p;
}

std::uint32_t CountLineFeeds(const char* p, const char* end) {
  std::uint32_t n = 0;
  while (p < end) {
    const void* hit = std::memchr(p, '\n', static_cast<std::size_t>(end - p));
    if (!hit) break;
    ++n;
    p = static_cast<const char*>(hit) + 1;
  }
  return n;
}

DataError UnterminatedQuote(const std::string& input, std::uint64_t line) {
  return DataError(input + ": line " + std::to_string(line) +
                   ": unterminated quote: the quoted field that starts here never ends");
}

}  // namespace

const char* FieldValue(const FieldRef& field, std::string& scratch, std::size_t* size) {
  if (!field.quoted) {
    *size = field.size;
    return field.data;
  }
  const char* p = field.data;
  const std::size_t n = field.size;
  // The common case: "text" with no quote inside.
  if (n >= 2 && p[n - 1] == '"' && !std::memchr(p + 1, '"', n - 2)) {
    *size = n - 2;
    return p + 1;
  }
  scratch.clear();
  bool inQuotes = true;
  for (std::size_t i = 1; i < n; ++i) {
    const char c = p[i];
    if (inQuotes && c == '"') {
      if (i + 1 < n && p[i + 1] == '"') {
        scratch.push_back('"');
        ++i;
      } else {
        inQuotes = false;
      }
    } else {
      scratch.push_back(c);
    }
  }
  *size = scratch.size();
  return scratch.data();
}

std::size_t FieldValueSize(const FieldRef& field) {
  if (!field.quoted) return field.size;
  const char* p = field.data;
  const std::size_t n = field.size;
  std::size_t size = 0;
  bool inQuotes = true;
  for (std::size_t i = 1; i < n; ++i) {
    if (inQuotes && p[i] == '"') {
      if (i + 1 < n && p[i + 1] == '"') {
        ++size;
        ++i;
      } else {
        inQuotes = false;
      }
    } else {
      ++size;
    }
  }
  return size;
}

CsvReader::CsvReader(FileHandle& input, const CsvFormat& format, std::size_t blockBytes,
                     std::size_t maxRowBytes)
    : input_(input), format_(format), block_(blockBytes), maxRow_(maxRowBytes), buffer_(blockBytes) {
  cur_ = end_ = buffer_.data();
}

bool CsvReader::Next(CsvRow& row, unsigned wanted) {
  for (;;) {
    if (cur_ == end_) {
      if (eof_) return false;
      Refill();
      continue;
    }
    if (ParseRow(cur_, wanted, row) == Parse::Row) {
      row.data = cur_;
      row.line = line_;
      line_ += row.lines;
      cur_ += row.size;
      consumed_ += row.size;
      return true;
    }
    Refill();
  }
}

void CsvReader::Refill() {
  const std::size_t keep = static_cast<std::size_t>(end_ - cur_);
  if (cur_ != buffer_.data()) {
    std::memmove(buffer_.data(), cur_, keep);
    cur_ = buffer_.data();
    end_ = cur_ + keep;
  }
  if (buffer_.size() - keep < block_ / 2 || buffer_.size() == keep) {
    // The row in hand is longer than what is left of the buffer: grow it.
    if (keep >= maxRow_) {
      throw DataError(input_.Name() + ": line " + std::to_string(line_) + ": a row longer than " +
                      std::to_string(maxRow_) + " bytes");
    }
    buffer_.resize(std::max(buffer_.size() * 2, keep + block_));
    cur_ = buffer_.data();
    end_ = cur_ + keep;
  }
  const std::size_t space = buffer_.size() - keep;
  const std::size_t n = input_.Read(end_, space);
  if (copy_ && n != 0) copy_->WriteAll(end_, n);
  end_ += n;
  if (n < space) eof_ = true;
}

void CsvReader::Unterminated(const char* rowBegin, const char* quote, std::uint64_t line) {
  throw UnterminatedQuote(input_.Name(), line + CountLineFeeds(rowBegin, quote));
}

CsvReader::Parse CsvReader::ParseRow(const char* begin, unsigned wanted, CsvRow& row) {
  const char* const end = end_;
  const char delimiter = format_.delimiter;
  const bool quoting = format_.quoting;
  const char* p = begin;
  unsigned field = 0;
  std::uint32_t lineFeeds = 0;
  bool walkFields = wanted > 0;
  bool slowTail = false;  // a quote was seen past the wanted fields

  for (;;) {
    if (!walkFields) {
      // Past the wanted fields only the row's end matters. Without a quote
      // before the next line feed, that line feed ends the row.
      const char* stop = quoting ? FindEither(p, end, '\n', '"')
                                 : static_cast<const char*>(std::memchr(p, '\n', static_cast<std::size_t>(end - p)));
      if (!stop) stop = end;
      const char* nl = stop < end && *stop == '\n' ? stop : nullptr;
      if (!quoting || stop == end || *stop == '\n') {
        if (!nl && !eof_) return Parse::NeedMore;
        row.fieldCount = std::min(field, wanted);
        if (nl) {
          row.terminator = (nl > begin && nl[-1] == '\r') ? 2 : 1;
          row.size = static_cast<std::size_t>(nl + 1 - begin);
          row.lines = lineFeeds + 1;
        } else {
          row.terminator = 0;
          row.size = static_cast<std::size_t>(end - begin);
          row.lines = lineFeeds;
        }
        return Parse::Row;
      }
      walkFields = true;  // a quote may open a field: walk the rest field by field
      slowTail = true;
    }

    const char* fieldBegin = p;
    bool quoted = false;
    if (quoting && p < end && *p == '"') {
      quoted = true;
      const char* q = p + 1;
      for (;;) {
        q = static_cast<const char*>(std::memchr(q, '"', static_cast<std::size_t>(end - q)));
        if (!q) {
          if (eof_) Unterminated(begin, p, line_);
          return Parse::NeedMore;
        }
        if (q + 1 == end) {
          if (!eof_) return Parse::NeedMore;  // the next byte decides
          break;
        }
        if (q[1] != '"') break;
        q += 2;
      }
      lineFeeds += CountLineFeeds(p + 1, q);
      p = q + 1;
    }
    const char* const plainBegin = p;
    p = FindEither(p, end, delimiter, '\n');
    if (p == end && !eof_) return Parse::NeedMore;

    const char* fieldEnd = p;
    if (p < end && *p == '\n' && fieldEnd > plainBegin && fieldEnd[-1] == '\r') --fieldEnd;
    if (field < wanted) {
      if (field >= row.fields.size()) row.fields.emplace_back();
      FieldRef& ref = row.fields[field];
      ref.data = fieldBegin;
      ref.size = static_cast<std::uint32_t>(fieldEnd - fieldBegin);
      ref.quoted = quoted;
    }
    ++field;
    if (p == end || *p == '\n') {
      row.fieldCount = std::min(field, wanted);
      if (p == end) {
        row.terminator = 0;
        row.size = static_cast<std::size_t>(end - begin);
        row.lines = lineFeeds;
      } else {
        row.terminator = (p > plainBegin && p[-1] == '\r') ? 2 : 1;
        row.size = static_cast<std::size_t>(p + 1 - begin);
        row.lines = lineFeeds + 1;
      }
      return Parse::Row;
    }
    ++p;  // the delimiter
    if (field >= wanted && !slowTail) walkFields = false;
  }
}

// ---------------------------------------------------------------------------

CsvScanner::CsvScanner(const CsvFormat& format, const std::vector<unsigned>& widthColumns,
                       std::uint64_t firstLine, std::string inputName)
    : format_(format), inputName_(std::move(inputName)), wanted_(0), line_(firstLine), histogram_(kHistogramLimit / 8 + 2, 0) {
  for (unsigned column : widthColumns) {
    if (column >= widthSlot_.size()) widthSlot_.resize(column + 1, -1);
    if (widthSlot_[column] < 0) {
      widthSlot_[column] = static_cast<int>(widths_.size());
      widths_.push_back(0);
    }
  }
  wanted_ = static_cast<unsigned>(widthSlot_.size());
  positionSlot_.reserve(widthColumns.size());
  for (unsigned column : widthColumns) positionSlot_.push_back(widthSlot_[column]);
}

std::uint64_t CsvScanner::Width(std::size_t i) const { return widths_[positionSlot_[i]]; }

void CsvScanner::EndField() {
  if (field_ < widthSlot_.size()) {
    const int slot = widthSlot_[field_];
    if (slot >= 0 && fieldSize_ > widths_[slot]) widths_[slot] = fieldSize_;
  }
  fieldSize_ = 0;
}

void CsvScanner::EndRow(std::uint64_t end, unsigned terminator) {
  const std::uint64_t length = end - rowStart_;
  ++rows_;
  if (length > longest_) longest_ = length;
  ++histogram_[length <= kHistogramLimit ? (length + 7) / 8 : kHistogramLimit / 8 + 1];
  if (terminator == 2) {
    ++crlf_;
  } else if (terminator == 1) {
    ++lf_;
  }
  if (terminator != 0) ++line_;
  rowStart_ = end;
  field_ = 0;
  fieldSize_ = 0;
  fieldStart_ = true;
  slowRow_ = false;
}

void CsvScanner::Scan(const char* data, std::size_t bytes) {
  const char* p = data;
  const char* const end = data + bytes;
  const std::uint64_t base = offset_;
  const char delimiter = format_.delimiter;
  const bool quoting = format_.quoting;

  while (p < end) {
    if (quotePending_) {
      quotePending_ = false;
      if (*p == '"') {  // a doubled quote: one quote of data, still quoted
        ++fieldSize_;
        ++p;
        continue;
      }
      inQuotes_ = false;  // the closing quote; *p is read as usual below
      last_ = '"';
    }
    if (inQuotes_) {
      const char* q = static_cast<const char*>(std::memchr(p, '"', static_cast<std::size_t>(end - p)));
      const char* stop = q ? q : end;
      line_ += CountLineFeeds(p, stop);
      fieldSize_ += static_cast<std::uint64_t>(stop - p);
      if (!q) break;
      p = q + 1;
      quotePending_ = true;
      continue;
    }
    if (field_ >= wanted_ && !slowRow_) {
      const char* stop = quoting ? FindEither(p, end, '\n', '"')
                                 : static_cast<const char*>(std::memchr(p, '\n', static_cast<std::size_t>(end - p)));
      if (!stop) stop = end;
      const char* nl = stop < end && *stop == '\n' ? stop : nullptr;
      if (!quoting || stop == end || *stop == '\n') {
        if (stop > p) {
          last_ = stop[-1];
          fieldStart_ = last_ == delimiter;
        }
        if (!nl) break;
        EndRow(base + static_cast<std::uint64_t>(nl + 1 - data), last_ == '\r' ? 2 : 1);
        last_ = '\n';
        p = nl + 1;
        continue;
      }
      slowRow_ = true;  // a quote before the row's end: walk byte by byte
    }
    if (fieldStart_ && quoting && *p == '"') {
      inQuotes_ = true;
      quoteLine_ = line_;
      fieldStart_ = false;
      last_ = '"';
      ++p;
      continue;
    }
    // The rest of a field outside quotes: up to the delimiter or line feed.
    fieldStart_ = false;
    const char* q = FindEither(p, end, delimiter, '\n');
    fieldSize_ += static_cast<std::uint64_t>(q - p);
    if (q > p) last_ = q[-1];
    p = q;
    if (q == end) break;
    if (*q == delimiter) {
      EndField();
      ++field_;
      fieldStart_ = true;
    } else {
      if (last_ == '\r' && fieldSize_ > 0) --fieldSize_;
      EndField();
      EndRow(base + static_cast<std::uint64_t>(q + 1 - data), last_ == '\r' ? 2 : 1);
    }
    last_ = *q;
    ++p;
  }
  offset_ += bytes;
}

void CsvScanner::Finish() {
  if (quotePending_) {
    quotePending_ = false;
    inQuotes_ = false;
  }
  if (inQuotes_) throw UnterminatedQuote(inputName_, quoteLine_);
  if (rowStart_ < offset_) {
    EndField();
    EndRow(offset_, 0);
    endsWithTerminator_ = false;
  } else {
    endsWithTerminator_ = true;
  }
}

}  // namespace isortcli

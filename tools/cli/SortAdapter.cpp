#include "SortAdapter.h"

#include <cstring>

#include "Errors.h"

namespace isortcli {
namespace {

// The cost of a row kept in the side store, in units of one padding value
// carried through the sort (copied, coded, stored, decoded, joined): a row
// kept in memory costs two copies, about 16 such values; a row read back
// from the side file costs a positioned read, about 256.
constexpr double kSideRowInMemory = 16.0;
constexpr double kSideRowInFile = 256.0;

constexpr std::size_t kSideBuffer = 1u << 20;

}  // namespace

std::uint32_t ChooseRowCapacity(const std::vector<std::uint64_t>& histogram, std::uint64_t rows,
                                std::uint64_t longest, std::uint64_t sideMemory) {
  if (rows == 0 || histogram.size() < 2) return 8;
  // Buckets 1 .. last-1 hold rows of 8k-7 .. 8k bytes; the last bucket holds
  // rows too long for any capacity. Bytes are estimated from the buckets'
  // upper bounds, with the side store's 8-byte length per row.
  const std::size_t huge = histogram.size() - 1;
  std::uint64_t longer = rows - histogram[0];  // rows longer than 8k, from k = 0
  double longerBytes = static_cast<double>(histogram[huge]) * static_cast<double>(8 * huge + 8);
  for (std::size_t k = 1; k < huge; ++k) longerBytes += static_cast<double>(histogram[k]) * static_cast<double>(8 * k + 8);
  std::size_t bestK = 1;
  double bestCost = -1;
  std::size_t lastK = (longest + 7) / 8;
  if (lastK >= huge) lastK = huge - 1;
  if (lastK < 1) lastK = 1;
  for (std::size_t k = 1; k <= lastK; ++k) {
    longer -= histogram[k];
    longerBytes -= static_cast<double>(histogram[k]) * static_cast<double>(8 * k + 8);
    const double perSideRow = longerBytes <= static_cast<double>(sideMemory) ? kSideRowInMemory : kSideRowInFile;
    const double cost = static_cast<double>(rows) * static_cast<double>(k) + perSideRow * static_cast<double>(longer);
    if (bestCost < 0 || cost < bestCost) {
      bestCost = cost;
      bestK = k;
    }
  }
  return static_cast<std::uint32_t>(bestK * 8);
}

// ---------------------------------------------------------------------------

std::uint64_t SideFile::Append(const char* data, std::size_t size) {
  const std::uint64_t offset = Bytes();
  const std::uint64_t length = size;
  Put(reinterpret_cast<const char*>(&length), sizeof length);
  Put(data, size);
  ++rows_;
  return offset;
}

void SideFile::Put(const char* data, std::size_t size) {
  if (!file_.IsOpen() && buffer_.size() + size > memoryBytes_) {
    // Too much for memory: everything moves to the file.
    file_ = FileHandle::CreateNameless(directory_, "file for long rows");
  }
  if (file_.IsOpen() && buffer_.size() + size > kSideBuffer) Flush();
  if (file_.IsOpen() && size >= kSideBuffer) {
    file_.WriteAll(data, size);
    flushed_ += size;
  } else {
    buffer_.append(data, size);
  }
}

void SideFile::Flush() {
  if (buffer_.empty()) return;
  file_.WriteAll(buffer_.data(), buffer_.size());
  flushed_ += buffer_.size();
  buffer_.clear();
}

const char* SideFile::Read(std::uint64_t offset, std::size_t* size) {
  std::uint64_t length;
  if (!file_.IsOpen()) {
    std::memcpy(&length, buffer_.data() + offset, sizeof length);
    *size = static_cast<std::size_t>(length);
    return buffer_.data() + offset + sizeof length;
  }
  Flush();
  file_.ReadAt(&length, sizeof length, offset);
  *size = static_cast<std::size_t>(length);
  if (row_.size() < *size) row_.resize(*size);
  file_.ReadAt(row_.data(), *size, offset + sizeof length);
  return row_.data();
}

// ---------------------------------------------------------------------------

CsvSorter::CsvSorter(KeyExtractor& extractor, std::uint32_t capacity, Statistics* stats, CsvReader& reader,
                     SideFile& side, RowWriter& writer, Progress& progress, std::uint64_t rows, bool pipelined)
    : FileSort(extractor.SortKeys(), Nvars(extractor, capacity), stats),
      extractor_(extractor),
      capacity_(capacity),
      keyValues_(extractor.KeyValues()),
      reader_(reader),
      side_(side),
      writer_(writer),
      progress_(progress),
      rows_(rows) {
  const unsigned nvars = Nvars(extractor, capacity);
  auto blank = [this](OBS* record) { std::memset(record + keyValues_ + 1, ' ', capacity_); };
  if (pipelined) {
    pipeline_.reset(new RecordPipeline(nvars, [this](OBS* record, std::size_t slot) { return Make(record, slot); }));
    pipeline_->InitBuffers(blank);
    padded_.assign(pipeline_->Slots(), 0);
  } else {
    record_.resize(nvars);
    blank(record_.data());
    padded_.assign(1, 0);
  }
}

bool CsvSorter::Make(OBS* record, std::size_t slot) {
  if (!reader_.Next(row_, extractor_.FieldsWanted())) return false;
  extractor_.Extract(row_, record);
  const std::size_t size = row_.size;
  char* bytes = reinterpret_cast<char*>(record + keyValues_ + 1);
  std::uint32_t& padded = padded_[slot];
  double place;
  if (size <= capacity_) {
    place = static_cast<double>(size) - 99.0;
    std::memcpy(bytes, row_.data, size);
    if (padded > size) std::memset(bytes + size, ' ', padded - size);
    padded = static_cast<std::uint32_t>(size);
  } else {
    place = -100.0 - static_cast<double>(side_.Append(row_.data, size));
    std::memset(bytes, ' ', padded);
    padded = 0;
  }
  std::memcpy(record + keyValues_, &place, sizeof place);
  return true;
}

const OBS* CsvSorter::GetRecord() {
  const OBS* record = nullptr;
  if (pipeline_) {
    record = pipeline_->Next();
  } else if (Make(record_.data(), 0)) {
    record = record_.data();
  }
  if (!record) {
    progress_.Start("sorting", 0, "", 1);
    return nullptr;
  }
  progress_.Update(++read_);
  return record;
}

void CsvSorter::PutRecord(const OBS* record) {
  if (written_ == 0) progress_.Start("writing", rows_, "rows", 1u << 16);
  double place;
  std::memcpy(&place, record + keyValues_, sizeof place);
  if (place >= -99.0) {
    writer_.WriteRow(reinterpret_cast<const char*>(record + keyValues_ + 1), static_cast<std::size_t>(place + 99.0));
  } else {
    std::size_t size;
    const char* row = side_.Read(static_cast<std::uint64_t>(-100.0 - place), &size);
    writer_.WriteRow(row, size);
  }
  progress_.Update(++written_);
}

// ---------------------------------------------------------------------------

BinarySorter::BinarySorter(const std::vector<SortKey>& keys, unsigned nvars, Statistics* stats,
                           FileHandle& input, OutputFile& output, Progress& progress, std::uint64_t records)
    : FileSort(keys, nvars, stats),
      input_(input),
      output_(output),
      progress_(progress),
      records_(records),
      recordBytes_(std::size_t{nvars} * 8) {
  // About 1 MiB, a whole number of records, at least one.
  std::size_t perBuffer = (std::size_t{1} << 20) / recordBytes_;
  if (perBuffer == 0) perBuffer = 1;
  buffer_.resize(perBuffer * nvars);
}

const OBS* BinarySorter::GetRecord() {
  if (next_ + recordBytes_ > have_) {
    char* bytes = reinterpret_cast<char*>(buffer_.data());
    const std::size_t keep = have_ - next_;
    if (keep != 0) std::memmove(bytes, bytes + next_, keep);
    have_ = keep;
    next_ = 0;
    if (!eof_) {
      const std::size_t space = buffer_.size() * 8 - have_;
      const std::size_t n = input_.Read(bytes + have_, space);
      have_ += n;
      eof_ = n < space;
    }
    if (have_ < recordBytes_) {
      if (have_ != 0) {
        throw DataError(input_.Name() + ": the input ends inside a record: " + std::to_string(read_ * recordBytes_ + have_) +
                        " bytes are not a whole number of " + std::to_string(recordBytes_) + "-byte records (" +
                        std::to_string(recordBytes_ / 8) + " values)");
      }
      progress_.Start("sorting", 0, "", 1);
      return nullptr;
    }
  }
  const OBS* record = reinterpret_cast<const OBS*>(reinterpret_cast<const char*>(buffer_.data()) + next_);
  next_ += recordBytes_;
  progress_.Update(++read_);
  return record;
}

void BinarySorter::PutRecord(const OBS* record) {
  if (written_ == 0) progress_.Start("writing", records_, "records", 1u << 16);
  output_.Write(record, recordBytes_);
  progress_.Update(++written_);
}

}  // namespace isortcli

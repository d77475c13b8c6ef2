// The FileSort subclasses that feed the sort library from an input and write
// its output: one for delimited text, one for binary records.
//
// The sort record of a text row is fixed-width, as the library's records are:
//
//   [key values][place][row bytes, blank-padded to the row capacity]
//
// The key values (Keys.h) come first, each key in its own slot. The row's
// bytes, terminator included, follow padded with blanks, so that a record
// carries its whole row and the output is written sequentially, never by
// re-reading the input. Padding costs little: the library stores the
// non-key values compressed, a value of eight blanks in one byte. The place
// value says where the row is: a row of n bytes that fits the capacity has
// n - 99 (one byte compressed up to n = 250); a longer row is kept in a side
// store in input order, and its place is -100 - (its offset there). The
// capacity is chosen from the first pass's histogram of row lengths
// (ChooseRowCapacity), so that one very long row does not widen every record.
#pragma once

#include <cstdint>
#include <memory>
#include <string>
#include <vector>

#include "CsvReader.h"
#include "CsvWriter.h"
#include "Keys.h"
#include "OutputFile.h"
#include "Progress.h"
#include "RecordPipeline.h"
#include "SysIo.h"
#include "isort/FileSort.h"

namespace isortcli {

// The row capacity in bytes (a multiple of 8, at least 8) that minimises the
// estimated cost of padding every record to it plus keeping each row longer
// than it in the side store, which holds `sideMemory` bytes in memory before
// it needs a file. `histogram` as CsvScanner gives it.
std::uint32_t ChooseRowCapacity(const std::vector<std::uint64_t>& histogram, std::uint64_t rows,
                                std::uint64_t longest, std::uint64_t sideMemory);

// Rows too long for their record, appended in input order and read back by
// offset. The first `memoryBytes` stay in memory; beyond that they all go to
// a nameless file in the temporary directory.
class SideFile {
 public:
  SideFile(std::string directory, std::size_t memoryBytes = 16u << 20)
      : directory_(std::move(directory)), memoryBytes_(memoryBytes) {}
  // Stores a row; returns its offset.
  std::uint64_t Append(const char* data, std::size_t size);
  // Reads back the row stored at `offset`; valid until the next call.
  const char* Read(std::uint64_t offset, std::size_t* size);
  std::uint64_t Rows() const { return rows_; }
  std::uint64_t Bytes() const { return flushed_ + buffer_.size(); }

 private:
  void Put(const char* data, std::size_t size);
  void Flush();
  std::string directory_;
  std::size_t memoryBytes_;
  FileHandle file_;        // open once the rows outgrow memory
  std::string buffer_;     // all rows while in memory; then the unwritten tail
  std::uint64_t flushed_ = 0;
  std::uint64_t rows_ = 0;
  std::vector<char> row_;  // Read()'s result when it comes from the file
};

class CsvSorter : public FileSort {
 public:
  // Rows come from `reader` (past any header), go to `writer`. `capacity`:
  // row bytes kept in the record. `rows`: the row count, for the progress
  // display. `pipelined`: rows are parsed on a thread of their own
  // (RecordPipeline.h). None of the references is owned.
  CsvSorter(KeyExtractor& extractor, std::uint32_t capacity, Statistics* stats, CsvReader& reader,
            SideFile& side, RowWriter& writer, Progress& progress, std::uint64_t rows, bool pipelined);

  const OBS* GetRecord() override;
  void PutRecord(const OBS* record) override;

  std::uint64_t RowsRead() const { return read_; }
  std::uint64_t RowsWritten() const { return written_; }
  static unsigned Nvars(const KeyExtractor& extractor, std::uint32_t capacity) {
    return extractor.KeyValues() + 1 + capacity / 8;
  }

 private:
  // Makes the record of the next row in `record`; false at the end.
  bool Make(OBS* record, std::size_t slot);

  KeyExtractor& extractor_;
  std::uint32_t capacity_;
  unsigned keyValues_;
  CsvReader& reader_;
  SideFile& side_;
  RowWriter& writer_;
  Progress& progress_;
  std::uint64_t rows_;
  CsvRow row_;
  std::vector<OBS> record_;          // the one buffer without a pipeline
  std::vector<std::uint32_t> padded_;  // per buffer: row bytes that are not blanks
  std::unique_ptr<RecordPipeline> pipeline_;
  std::uint64_t read_ = 0;
  std::uint64_t written_ = 0;
};

// Binary records of `nvars` raw 8-byte values, sorted as they are.
class BinarySorter : public FileSort {
 public:
  BinarySorter(const std::vector<SortKey>& keys, unsigned nvars, Statistics* stats, FileHandle& input,
               OutputFile& output, Progress& progress, std::uint64_t records);

  const OBS* GetRecord() override;
  void PutRecord(const OBS* record) override;

  std::uint64_t RecordsRead() const { return read_; }

 private:
  FileHandle& input_;
  OutputFile& output_;
  Progress& progress_;
  std::uint64_t records_;
  std::size_t recordBytes_;
  std::vector<OBS> buffer_;
  std::size_t have_ = 0;  // bytes in buffer_
  std::size_t next_ = 0;  // byte offset of the next record in buffer_
  bool eof_ = false;
  std::uint64_t read_ = 0;
  std::uint64_t written_ = 0;
};

}  // namespace isortcli

// Reading runs back from their temporary files, and giving up copied files.
#include <algorithm>
#include <string>

#include "FileSortInternal.h"
#include "isort/host/rtassert.h"

namespace {

ErrorText Damaged(const VEXA_StrBaseIO* stream, const char* what) {
  const auto* file = static_cast<const FileSort::WorkFile*>(stream);
  return ErrorText(std::string("temporary file ") + file->Name() + " is damaged: " + what);
}

}  // namespace

RunReader::RunReader(const RunDescriptor& run)
    : start(run.start), end(run.end), stream(run.stream), ownsStream(false) {}

RunReader::~RunReader() {
  delete[] entry;
  delete[] rest;
  if (ownsStream) delete stream;
}

void RunReader::Allocate(unsigned int keyValues, unsigned int restValues) {
  delete[] entry;
  entry = nullptr;
  delete[] rest;
  rest = nullptr;
  K = keyValues;
  R = restValues;
  entry = new OBS[CheckedBytes(std::uint64_t{K} + 1, sizeof(OBS)) / sizeof(OBS)];
  if (R != 0) rest = new OBS[CheckedBytes(R, sizeof(OBS)) / sizeof(OBS)];
}

void RunReader::Open() {
  if (!ownsStream) {
    stream = new FileSort::WorkFile(*static_cast<FileSort::WorkFile*>(stream));
    ownsStream = true;
  }
  stream->Seek(start, VEXA_StrBaseIO::SeekBegin);
}

bool RunReader::ReadNext() {
  if (!ownsStream) Open();
  if (stream->Tell() >= end) return false;
  if (!ReadCompressed(*stream, entry, static_cast<long>(K) + 1)) {
    throw Damaged(stream, "a sort entry could not be decoded");
  }
  // The stored tag is run number - 99; a value no run number gives means the
  // file is not what the sort wrote.
  double tag;
  std::memcpy(&tag, entry + K, sizeof tag);
  if (!(tag >= -99.0 && tag <= 4294967295.0 - 99.0)) throw Damaged(stream, "a run tag is out of range");
  const std::int64_t run = static_cast<std::int64_t>(tag + 99.0);
  if (static_cast<double>(run) != tag + 99.0) throw Damaged(stream, "a run tag is not a whole number");
  SetTag(entry + K, static_cast<std::uint32_t>(run));
  if (R != 0 && !ReadRest(rest, R)) {
    VexaRuntimeAssert(L"more", L"backend/isort/RunReader.cpp", __LINE__);
    throw Damaged(stream, "a sort entry has no rest part");
  }
  if (stream->Tell() > end) throw Damaged(stream, "a record runs past the end of its run");
  return true;
}

bool RunReader::ReadRest(OBS* buffer, long count) {
  if (!ownsStream) Open();
  if (stream->Tell() >= end) return false;
  if (!ReadCompressed(*stream, buffer, count)) {
    throw Damaged(stream, "a record's rest part could not be decoded");
  }
  return true;
}

void FileSort::Data::ReleaseSharedFiles() {
  // A file object whose runs are not all taken yet must stay: descriptors in
  // the run list still point at it.
  auto referenced = [this](const WorkFile* file) {
    return std::any_of(runs.begin(), runs.end(),
                       [file](const RunDescriptor& run) { return run.stream == file; });
  };
  for (std::size_t i = 0; i < workFiles.size();) {
    WorkFile* file = workFiles[i];
    if (file->IsShared() && !referenced(file)) {
      workFiles.erase(workFiles.begin() + static_cast<std::ptrdiff_t>(i));
      delete file;
    } else {
      ++i;
    }
  }
}

// VEXA_TempFile: a file stream over a new file in the host's temporary
// directory.
#include <memory>

#include "host/hostsettings.h"
#include "isort/host/errhub.h"
#include "streamwindow.h"

VEXA_TempFile::VEXA_TempFile(const char* prefix, bool removeWhenDone) {
  std::unique_ptr<SharedFile> file(new SharedFile);
  file->removeWhenDone = removeWhenDone;
  int error = vexahost::sys::CreateTemp(vexahost::TempDirectory(), prefix ? prefix : "",
                                        removeWhenDone, &file->handle, &file->name);
  if (error)
    throw ErrorText("create of " + file->name + " failed: " + vexahost::sys::ErrorString(error));
  Attach(file.release());
}

VEXA_TempFile::VEXA_TempFile(const VEXA_TempFile& other) : VEXA_FileStream(other) {}

VEXA_TempFile::~VEXA_TempFile() {}

void VEXA_TempFile::Close() { VEXA_StreamWindow::Release(*this, true); }

void VEXA_TempFile::Flush() const { FlushBuffer(); }

const char* VEXA_TempFile::Name() const { return file_ ? file_->name.c_str() : ""; }

unsigned int VEXA_TempFile::Footprint() const { return bufferSize_; }

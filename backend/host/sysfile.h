// The stand-in host's only door to the operating system's files: temporary
// and named files, positioned transfers, size queries and the system's error
// texts. Every call here consults the fault plan (faultplan.h) first.
//
// Functions return 0 on success or the system's error code (errno on POSIX,
// GetLastError() on Windows), which ErrorString() turns into text.
#pragma once

#include <cstddef>
#include <cstdint>
#include <string>

namespace vexahost {
namespace sys {

#ifdef _WIN32
typedef void* Handle;  // HANDLE
#else
typedef int Handle;
#endif
Handle NoHandle();

// Creates a new file named `prefix` plus a unique suffix in `directory`,
// open for reading and writing. With removeWhenDone the file is removed when
// its handle is closed, also when the process dies (POSIX: unlinked at once;
// Windows: delete-on-close). `*path` receives the name as created, or the
// pattern tried when creation fails.
int CreateTemp(const std::string& directory, const std::string& prefix, bool removeWhenDone,
               Handle* handle, std::string* path);

// Opens a named file. `create` makes it when missing, `truncate` empties it.
int OpenFile(const std::string& path, bool read, bool write, bool create, bool truncate,
             Handle* handle);

// The file's current size in bytes.
int FileSize(Handle handle, std::int64_t* size);

// One positioned transfer of up to `bytes`; `*moved` receives the count
// actually moved, which may be short (0: no progress).
int ReadAt(Handle handle, void* buffer, std::size_t bytes, std::int64_t offset,
           std::size_t* moved);
int WriteAt(Handle handle, const void* buffer, std::size_t bytes, std::int64_t offset,
            std::size_t* moved);

int Close(Handle handle);

// The system's text for an error code returned above.
std::string ErrorString(int error);

// The error code for an operation the file was not opened for.
int NotPermittedError();

}  // namespace sys
}  // namespace vexahost

// The operating system's file calls, behind the fault plan.
#include "sysfile.h"

#include <algorithm>
#include <cerrno>
#include <cstring>

#include "faulthook.h"

#ifdef _WIN32
#include <windows.h>
#else
#include <fcntl.h>
#include <sys/stat.h>
#include <unistd.h>
#endif

namespace vexahost {
namespace sys {
namespace {

using internal::ConsultFaultPlan;
using internal::FaultVerdict;

// One call moves at most this much, so counts fit every platform's types.
constexpr std::size_t kMaxTransfer = std::size_t(1) << 30;

// Applies a verdict to a transfer of `bytes`; false when the call must not
// reach the system (the outcome is then in *error and *moved).
bool Planned(const FaultVerdict& verdict, std::size_t* bytes, int* error, std::size_t* moved) {
  *moved = 0;
  *error = verdict.error;
  if (verdict.error || verdict.noProgress) return false;
  if (verdict.partial) *bytes = *bytes > 1 ? *bytes / 2 : 0;
  return *bytes != 0 || !verdict.partial;
}

#ifndef _WIN32
// strerror_r has two signatures; these pick the result of either.
inline const char* ErrorResult(int result, const char* buffer) {
  return result == 0 ? buffer : nullptr;
}
inline const char* ErrorResult(const char* result, const char*) { return result; }
#endif

}  // namespace

#ifdef _WIN32

Handle NoHandle() { return INVALID_HANDLE_VALUE; }

int CreateTemp(const std::string& directory, const std::string& prefix, bool removeWhenDone,
               Handle* handle, std::string* path) {
  *handle = INVALID_HANDLE_VALUE;
  std::string base = directory;
  if (!base.empty() && base.back() != '\\' && base.back() != '/') base += '\\';
  base += prefix;
  *path = base + "XXXXXX.tmp";
  if (FaultVerdict v = ConsultFaultPlan(FileOp::Create); v.error) return v.error;
  static LONG counter = 0;
  DWORD flags = FILE_ATTRIBUTE_TEMPORARY | (removeWhenDone ? FILE_FLAG_DELETE_ON_CLOSE : 0);
  for (int attempt = 0; attempt < 1000; ++attempt) {
    unsigned long long seed = (static_cast<unsigned long long>(GetCurrentProcessId()) << 32) ^
                              (static_cast<unsigned long long>(InterlockedIncrement(&counter)) << 12) ^
                              GetTickCount();
    char suffix[7];
    static const char kDigits[] = "0123456789abcdefghijklmnopqrstuvwxyz";
    for (int i = 0; i < 6; ++i) {
      suffix[i] = kDigits[seed % 36];
      seed /= 36;
    }
    suffix[6] = 0;
    std::string name = base + suffix + ".tmp";
    HANDLE h = CreateFileA(name.c_str(), GENERIC_READ | GENERIC_WRITE,
                           FILE_SHARE_READ | FILE_SHARE_WRITE | FILE_SHARE_DELETE, nullptr,
                           CREATE_NEW, flags, nullptr);
    if (h != INVALID_HANDLE_VALUE) {
      *handle = h;
      *path = name;
      return 0;
    }
    DWORD error = GetLastError();
    if (error != ERROR_FILE_EXISTS && error != ERROR_ALREADY_EXISTS) return static_cast<int>(error);
  }
  return ERROR_FILE_EXISTS;
}

int OpenFile(const std::string& path, bool read, bool write, bool create, bool truncate,
             Handle* handle) {
  *handle = INVALID_HANDLE_VALUE;
  if (FaultVerdict v = ConsultFaultPlan(FileOp::Create); v.error) return v.error;
  DWORD access = (read ? GENERIC_READ : 0) | (write ? GENERIC_WRITE : 0);
  DWORD disposition = create ? (truncate ? CREATE_ALWAYS : OPEN_ALWAYS)
                             : (truncate ? TRUNCATE_EXISTING : OPEN_EXISTING);
  HANDLE h = CreateFileA(path.c_str(), access, FILE_SHARE_READ | FILE_SHARE_WRITE, nullptr,
                         disposition, FILE_ATTRIBUTE_NORMAL, nullptr);
  if (h == INVALID_HANDLE_VALUE) return static_cast<int>(GetLastError());
  *handle = h;
  return 0;
}

int FileSize(Handle handle, std::int64_t* size) {
  if (FaultVerdict v = ConsultFaultPlan(FileOp::Seek); v.error) return v.error;
  LARGE_INTEGER n;
  if (!GetFileSizeEx(handle, &n)) return static_cast<int>(GetLastError());
  *size = n.QuadPart;
  return 0;
}

int ReadAt(Handle handle, void* buffer, std::size_t bytes, std::int64_t offset,
           std::size_t* moved) {
  int error;
  if (!Planned(ConsultFaultPlan(FileOp::Read), &bytes, &error, moved)) return error;
  OVERLAPPED at = {};
  at.Offset = static_cast<DWORD>(static_cast<std::uint64_t>(offset));
  at.OffsetHigh = static_cast<DWORD>(static_cast<std::uint64_t>(offset) >> 32);
  DWORD done = 0;
  if (!ReadFile(handle, buffer, static_cast<DWORD>(std::min(bytes, kMaxTransfer)), &done, &at)) {
    DWORD e = GetLastError();
    if (e != ERROR_HANDLE_EOF) return static_cast<int>(e);
  }
  *moved = done;
  return 0;
}

int WriteAt(Handle handle, const void* buffer, std::size_t bytes, std::int64_t offset,
            std::size_t* moved) {
  int error;
  if (!Planned(ConsultFaultPlan(FileOp::Write), &bytes, &error, moved)) return error;
  OVERLAPPED at = {};
  at.Offset = static_cast<DWORD>(static_cast<std::uint64_t>(offset));
  at.OffsetHigh = static_cast<DWORD>(static_cast<std::uint64_t>(offset) >> 32);
  DWORD done = 0;
  if (!WriteFile(handle, buffer, static_cast<DWORD>(std::min(bytes, kMaxTransfer)), &done, &at))
    return static_cast<int>(GetLastError());
  *moved = done;
  return 0;
}

int Close(Handle handle) { return CloseHandle(handle) ? 0 : static_cast<int>(GetLastError()); }

std::string ErrorString(int error) {
  char* text = nullptr;
  DWORD n = FormatMessageA(FORMAT_MESSAGE_ALLOCATE_BUFFER | FORMAT_MESSAGE_FROM_SYSTEM |
                               FORMAT_MESSAGE_IGNORE_INSERTS,
                           nullptr, static_cast<DWORD>(error), 0,
                           reinterpret_cast<char*>(&text), 0, nullptr);
  std::string message;
  if (n && text) message.assign(text, n);
  if (text) LocalFree(text);
  while (!message.empty() && (message.back() == '\n' || message.back() == '\r' ||
                              message.back() == ' ' || message.back() == '.'))
    message.pop_back();
  if (message.empty()) message = "system error " + std::to_string(error);
  return message;
}

int NotPermittedError() { return ERROR_ACCESS_DENIED; }

#else  // POSIX

Handle NoHandle() { return -1; }

int CreateTemp(const std::string& directory, const std::string& prefix, bool removeWhenDone,
               Handle* handle, std::string* path) {
  *handle = -1;
  std::string name = directory;
  if (!name.empty() && name.back() != '/') name += '/';
  name += prefix;
  name += "XXXXXX";
  *path = name;
  if (FaultVerdict v = ConsultFaultPlan(FileOp::Create); v.error) return v.error;
#ifdef __linux__
  int fd = mkostemp(&name[0], O_CLOEXEC);
#else
  int fd = mkstemp(&name[0]);
#endif
  if (fd < 0) return errno;
  if (removeWhenDone && unlink(name.c_str()) != 0) {
    int error = errno;
    ::close(fd);
    return error;
  }
  *handle = fd;
  *path = name;
  return 0;
}

int OpenFile(const std::string& path, bool read, bool write, bool create, bool truncate,
             Handle* handle) {
  *handle = -1;
  if (FaultVerdict v = ConsultFaultPlan(FileOp::Create); v.error) return v.error;
  int flags = read && write ? O_RDWR : write ? O_WRONLY : O_RDONLY;
  if (create) flags |= O_CREAT;
  if (truncate) flags |= O_TRUNC;
#ifdef O_CLOEXEC
  flags |= O_CLOEXEC;
#endif
  int fd;
  do fd = ::open(path.c_str(), flags, 0666);
  while (fd < 0 && errno == EINTR);
  if (fd < 0) return errno;
  *handle = fd;
  return 0;
}

int FileSize(Handle handle, std::int64_t* size) {
  if (FaultVerdict v = ConsultFaultPlan(FileOp::Seek); v.error) return v.error;
  struct stat st;
  if (fstat(handle, &st) != 0) return errno;
  *size = st.st_size;
  return 0;
}

int ReadAt(Handle handle, void* buffer, std::size_t bytes, std::int64_t offset,
           std::size_t* moved) {
  int error;
  if (!Planned(ConsultFaultPlan(FileOp::Read), &bytes, &error, moved)) return error;
  ssize_t n;
  do n = ::pread(handle, buffer, std::min(bytes, kMaxTransfer), static_cast<off_t>(offset));
  while (n < 0 && errno == EINTR);
  if (n < 0) return errno;
  *moved = static_cast<std::size_t>(n);
  return 0;
}

int WriteAt(Handle handle, const void* buffer, std::size_t bytes, std::int64_t offset,
            std::size_t* moved) {
  int error;
  if (!Planned(ConsultFaultPlan(FileOp::Write), &bytes, &error, moved)) return error;
  ssize_t n;
  do n = ::pwrite(handle, buffer, std::min(bytes, kMaxTransfer), static_cast<off_t>(offset));
  while (n < 0 && errno == EINTR);
  if (n < 0) return errno;
  *moved = static_cast<std::size_t>(n);
  return 0;
}

int Close(Handle handle) { return ::close(handle) == 0 ? 0 : errno; }

std::string ErrorString(int error) {
  char buffer[256] = "";
  const char* text = ErrorResult(strerror_r(error, buffer, sizeof buffer), buffer);
  if (text && *text) return text;
  return "system error " + std::to_string(error);
}

int NotPermittedError() { return EBADF; }

#endif

}  // namespace sys
}  // namespace vexahost

#include "SysIo.h"

#include <cerrno>
#include <cstring>
#include <random>

#include "Errors.h"

#ifdef _WIN32
#include <fcntl.h>
#include <io.h>
#include <sys/stat.h>
#include <windows.h>
#else
#include <fcntl.h>
#include <sys/stat.h>
#include <unistd.h>
#endif

namespace isortcli {
namespace {

[[noreturn]] void Fail(const std::string& what, const std::string& name, int error) {
  throw DataError(what + " " + name + ": " + SystemErrorText(error));
}

// One transfer must fit an int on Windows and should stay below 1 GiB anywhere.
constexpr std::size_t kMaxTransfer = std::size_t{1} << 30;

}  // namespace

std::string SystemErrorText(int error) { return std::strerror(error); }

FileHandle& FileHandle::operator=(FileHandle&& other) noexcept {
  if (this != &other) {
    Close();
    fd_ = other.fd_;
    name_ = std::move(other.name_);
    owned_ = other.owned_;
    other.fd_ = -1;
    other.owned_ = false;
  }
  return *this;
}

void FileHandle::Close() noexcept {
#ifdef _WIN32
  if (fd_ >= 0 && owned_) _close(fd_);
#else
  if (fd_ >= 0 && owned_) ::close(fd_);
#endif
  fd_ = -1;
  owned_ = false;
}

FileHandle FileHandle::OpenRead(const std::string& path) {
#ifdef _WIN32
  int fd = _open(path.c_str(), _O_RDONLY | _O_BINARY);
#else
  int fd = ::open(path.c_str(), O_RDONLY | O_CLOEXEC);
#endif
  if (fd < 0) Fail("cannot open input", path, errno);
  return FileHandle(fd, path, true);
}

FileHandle FileHandle::StandardInput() {
#ifdef _WIN32
  _setmode(0, _O_BINARY);
#endif
  return FileHandle(0, "standard input", false);
}

FileHandle FileHandle::StandardOutput() {
#ifdef _WIN32
  _setmode(1, _O_BINARY);
#endif
  return FileHandle(1, "standard output", false);
}

FileHandle FileHandle::CreateNameless(const std::string& directory, const std::string& purpose) {
  const std::string what = "cannot create the " + purpose + " in";
  const std::string name = "the " + purpose + " in " + directory;
#ifdef _WIN32
  std::random_device seed;
  std::mt19937_64 rng(seed());
  for (int attempt = 0; attempt < 100; ++attempt) {
    const std::string path = directory + "\\isort-" + std::to_string(rng() % 1000000000ull) + ".tmp";
    int fd = _open(path.c_str(), _O_RDWR | _O_BINARY | _O_CREAT | _O_EXCL | _O_TEMPORARY,
                   _S_IREAD | _S_IWRITE);
    if (fd >= 0) return FileHandle(fd, name, true);
    if (errno != EEXIST) Fail(what, directory, errno);
  }
  Fail(what, directory, EEXIST);
#else
  int fd = -1;
#ifdef O_TMPFILE
  fd = ::open(directory.c_str(), O_TMPFILE | O_RDWR | O_CLOEXEC, 0600);
  if (fd >= 0) return FileHandle(fd, name, true);
  // Only "not supported here" falls back; a real error is reported as it is.
  if (errno != EOPNOTSUPP && errno != EISDIR && errno != EINVAL) Fail(what, directory, errno);
#endif
  std::string pattern = directory + "/isort-XXXXXX";
  fd = ::mkstemp(&pattern[0]);
  if (fd < 0) Fail(what, directory, errno);
  ::unlink(pattern.c_str());
  ::fcntl(fd, F_SETFD, FD_CLOEXEC);
  return FileHandle(fd, name, true);
#endif
}

std::size_t FileHandle::Read(void* buffer, std::size_t bytes) {
  char* p = static_cast<char*>(buffer);
  std::size_t done = 0;
  while (done < bytes) {
    std::size_t chunk = bytes - done < kMaxTransfer ? bytes - done : kMaxTransfer;
#ifdef _WIN32
    int n = _read(fd_, p + done, static_cast<unsigned>(chunk));
#else
    ssize_t n = ::read(fd_, p + done, chunk);
#endif
    if (n < 0) {
      if (errno == EINTR) continue;
      Fail("cannot read", name_, errno);
    }
    if (n == 0) break;
    done += static_cast<std::size_t>(n);
  }
  return done;
}

void FileHandle::ReadAt(void* buffer, std::size_t bytes, std::uint64_t offset) {
  char* p = static_cast<char*>(buffer);
  std::size_t done = 0;
  while (done < bytes) {
    std::size_t chunk = bytes - done < kMaxTransfer ? bytes - done : kMaxTransfer;
#ifdef _WIN32
    // Only the caller's thread reads this file, so seek-then-read is enough.
    if (_lseeki64(fd_, static_cast<__int64>(offset + done), SEEK_SET) < 0) Fail("cannot seek in", name_, errno);
    int n = _read(fd_, p + done, static_cast<unsigned>(chunk));
#else
    ssize_t n = ::pread(fd_, p + done, chunk, static_cast<off_t>(offset + done));
#endif
    if (n < 0) {
      if (errno == EINTR) continue;
      Fail("cannot read", name_, errno);
    }
    if (n == 0) throw DataError("cannot read " + name_ + ": the file is shorter than expected");
    done += static_cast<std::size_t>(n);
  }
}

void FileHandle::WriteAll(const void* buffer, std::size_t bytes) {
  const char* p = static_cast<const char*>(buffer);
  std::size_t done = 0;
  while (done < bytes) {
    std::size_t chunk = bytes - done < kMaxTransfer ? bytes - done : kMaxTransfer;
#ifdef _WIN32
    int n = _write(fd_, p + done, static_cast<unsigned>(chunk));
#else
    ssize_t n = ::write(fd_, p + done, chunk);
#endif
    if (n < 0) {
      if (errno == EINTR) continue;
      Fail("cannot write", name_, errno);
    }
    if (n == 0) Fail("cannot write", name_, ENOSPC);
    done += static_cast<std::size_t>(n);
  }
}

void FileHandle::Rewind() {
#ifdef _WIN32
  if (_lseeki64(fd_, 0, SEEK_SET) < 0) Fail("cannot seek in", name_, errno);
#else
  if (::lseek(fd_, 0, SEEK_SET) < 0) Fail("cannot seek in", name_, errno);
#endif
}

std::int64_t FileHandle::RegularSize() const {
#ifdef _WIN32
  struct _stat64 st;
  if (_fstat64(fd_, &st) != 0 || (st.st_mode & _S_IFMT) != _S_IFREG) return -1;
  return st.st_size;
#else
  struct stat st;
  if (::fstat(fd_, &st) != 0 || !S_ISREG(st.st_mode)) return -1;
  return st.st_size;
#endif
}

bool StandardErrorIsTerminal() {
#ifdef _WIN32
  return _isatty(2) != 0;
#else
  return ::isatty(2) != 0;
#endif
}

std::string DirectoryOf(const std::string& path) {
#ifdef _WIN32
  const std::size_t slash = path.find_last_of("/\\");
#else
  const std::size_t slash = path.find_last_of('/');
#endif
  if (slash == std::string::npos) return ".";
  if (slash == 0) return path.substr(0, 1);
  return path.substr(0, slash);
}

}  // namespace isortcli

#include "OutputFile.h"

#include <cerrno>
#include <csignal>
#include <cstdio>
#include <random>
#include <utility>

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

// The one hidden output name that a signal must remove. A process writes one
// output file at a time, so one slot is enough; the handler reads only these
// two objects and calls only async-signal-safe functions.
char g_cleanupPath[4096];
volatile std::sig_atomic_t g_cleanupArmed = 0;

extern "C" void RemoveOnSignal(int sig) {
  if (g_cleanupArmed) {
#ifdef _WIN32
    _unlink(g_cleanupPath);
#else
    ::unlink(g_cleanupPath);
#endif
  }
  std::signal(sig, SIG_DFL);
  std::raise(sig);
}

void InstallSignalCleanup() {
  static bool installed = false;
  if (installed) return;
  installed = true;
#ifdef _WIN32
  std::signal(SIGINT, RemoveOnSignal);
  std::signal(SIGTERM, RemoveOnSignal);
#else
  struct sigaction action;
  std::memset(&action, 0, sizeof action);
  action.sa_handler = RemoveOnSignal;
  sigemptyset(&action.sa_mask);
  for (int sig : {SIGINT, SIGTERM, SIGHUP}) {
    struct sigaction old;
    // A signal the shell set to be ignored stays ignored.
    if (::sigaction(sig, nullptr, &old) == 0 && old.sa_handler == SIG_IGN) continue;
    ::sigaction(sig, &action, nullptr);
  }
#endif
}

// Arms the signal handler for `path`; false when the path is too long to hold,
// in which case a signal would leave the file behind.
void ArmCleanup(const std::string& path) {
  g_cleanupArmed = 0;
  if (path.size() >= sizeof g_cleanupPath) return;
  std::memcpy(g_cleanupPath, path.c_str(), path.size() + 1);
  g_cleanupArmed = 1;
}

void DisarmCleanup() { g_cleanupArmed = 0; }

std::string BaseName(const std::string& path) {
#ifdef _WIN32
  const std::size_t slash = path.find_last_of("/\\");
#else
  const std::size_t slash = path.find_last_of('/');
#endif
  return slash == std::string::npos ? path : path.substr(slash + 1);
}

std::string JoinPath(const std::string& dir, const std::string& name) {
  if (dir.empty() || dir.back() == '/') return dir + name;
  return dir + "/" + name;
}

// A hidden name beside `path` with a random suffix.
std::string HiddenName(const std::string& path) {
  static std::mt19937_64 rng(std::random_device{}());
  static const char digits[] = "abcdefghijklmnopqrstuvwxyz0123456789";
  std::string suffix;
  for (int i = 0; i < 8; ++i) suffix += digits[rng() % 36];
  return JoinPath(DirectoryOf(path), "." + BaseName(path) + "." + suffix);
}

[[noreturn]] void Fail(const std::string& what, const std::string& name, int error) {
  throw DataError(what + " " + name + ": " + SystemErrorText(error));
}

}  // namespace

OutputFile::OutputFile(const std::string& path, std::size_t bufferBytes)
    : buffer_(new char[bufferBytes]), spare_(new char[bufferBytes]), capacity_(bufferBytes) {
  if (path.empty() || path == "-") {
    file_ = FileHandle::StandardOutput();
    displayName_ = "standard output";
    return;
  }
  displayName_ = path;
#ifdef _WIN32
  struct _stat64 st;
  const bool exists = _stat64(path.c_str(), &st) == 0;
  if (exists && (st.st_mode & _S_IFMT) != _S_IFREG) {
    int fd = _open(path.c_str(), _O_WRONLY | _O_BINARY | _O_TRUNC);
    if (fd < 0) Fail("cannot open output", path, errno);
    file_ = FileHandle(fd, path, true);
    return;
  }
  InstallSignalCleanup();
  for (int attempt = 0;; ++attempt) {
    std::string hidden = HiddenName(path);
    ArmCleanup(hidden);
    int fd = _open(hidden.c_str(), _O_WRONLY | _O_BINARY | _O_CREAT | _O_EXCL, _S_IREAD | _S_IWRITE);
    if (fd >= 0) {
      file_ = FileHandle(fd, path, true);
      hiddenPath_ = hidden;
      break;
    }
    DisarmCleanup();
    if (errno != EEXIST || attempt == 100) Fail("cannot create output", path, errno);
  }
  finalPath_ = path;
  replaces_ = exists;
#else
  struct stat st;
  const bool exists = ::stat(path.c_str(), &st) == 0;
  if (exists && !S_ISREG(st.st_mode)) {
    int fd = ::open(path.c_str(), O_WRONLY | O_TRUNC | O_CLOEXEC);
    if (fd < 0) Fail("cannot open output", path, errno);
    file_ = FileHandle(fd, path, true);
    return;
  }
  if (exists && S_ISDIR(st.st_mode)) Fail("cannot create output", path, EISDIR);
  finalPath_ = path;
  replaces_ = exists;
  const mode_t mode = exists ? (st.st_mode & 07777) : 0666;
  const std::string dir = DirectoryOf(path);
  int fd = -1;
#ifdef O_TMPFILE
  fd = ::open(dir.c_str(), O_TMPFILE | O_WRONLY | O_CLOEXEC, 0666);
  if (fd >= 0) {
    // Linking needs /proc (an unprivileged linkat of a descriptor); without
    // it, fall back to the hidden name.
    const std::string self = "/proc/self/fd/" + std::to_string(fd);
    if (::access(self.c_str(), F_OK) == 0) {
      nameless_ = true;
      if (exists) ::fchmod(fd, mode);
    } else {
      ::close(fd);
      fd = -1;
    }
  } else if (errno != EOPNOTSUPP && errno != EISDIR && errno != EINVAL) {
    Fail("cannot create output", path, errno);
  }
#endif
  if (fd < 0) {
    InstallSignalCleanup();
    for (int attempt = 0;; ++attempt) {
      std::string hidden = HiddenName(path);
      ArmCleanup(hidden);
      fd = ::open(hidden.c_str(), O_WRONLY | O_CREAT | O_EXCL | O_CLOEXEC, mode);
      if (fd >= 0) {
        hiddenPath_ = hidden;
        if (exists) ::fchmod(fd, mode);
        break;
      }
      DisarmCleanup();
      if (errno != EEXIST || attempt == 100) Fail("cannot create output", path, errno);
    }
  }
  file_ = FileHandle(fd, path, true);
#endif
}

OutputFile::~OutputFile() {
  if (!committed_) Discard();
}

void OutputFile::Discard() noexcept {
  writer_.reset();
  file_.Close();
  if (!hiddenPath_.empty()) {
#ifdef _WIN32
    _unlink(hiddenPath_.c_str());
#else
    ::unlink(hiddenPath_.c_str());
#endif
    hiddenPath_.clear();
  }
  DisarmCleanup();
}

void OutputFile::WriteSlow(const void* data, std::size_t bytes) {
  Flush();
  if (bytes >= capacity_) {
    if (writer_) writer_->Wait();
    file_.WriteAll(data, bytes);
    return;
  }
  std::memcpy(buffer_.get(), data, bytes);
  used_ = bytes;
}

void OutputFile::Flush() {
  if (used_ == 0) return;
  if (!writer_) writer_.reset(new BackgroundWriter(file_));
  writer_->Hand(buffer_.get(), used_);
  std::swap(buffer_, spare_);
  used_ = 0;
}

void OutputFile::Commit() {
  Flush();
  if (writer_) {
    writer_->Wait();
    writer_.reset();
  }
  if (finalPath_.empty()) {
    committed_ = true;
    file_.Close();
    return;
  }
#ifdef _WIN32
  file_.Close();
  if (!MoveFileExA(hiddenPath_.c_str(), finalPath_.c_str(), MOVEFILE_REPLACE_EXISTING)) {
    Fail("cannot rename the output to", finalPath_, EACCES);
  }
  hiddenPath_.clear();
  DisarmCleanup();
#else
  if (nameless_) {
    const std::string self = "/proc/self/fd/" + std::to_string(file_.Fd());
    bool linked = false;
    if (!replaces_) {
      if (::linkat(AT_FDCWD, self.c_str(), AT_FDCWD, finalPath_.c_str(), AT_SYMLINK_FOLLOW) == 0) {
        linked = true;
      } else if (errno != EEXIST) {
        Fail("cannot create output", finalPath_, errno);
      }
    }
    if (!linked) {
      // Link under a hidden name, then rename over the existing file: rename
      // replaces it in one step.
      for (int attempt = 0;; ++attempt) {
        std::string hidden = HiddenName(finalPath_);
        ArmCleanup(hidden);
        if (::linkat(AT_FDCWD, self.c_str(), AT_FDCWD, hidden.c_str(), AT_SYMLINK_FOLLOW) == 0) {
          hiddenPath_ = hidden;
          break;
        }
        DisarmCleanup();
        if (errno != EEXIST || attempt == 100) Fail("cannot create output", finalPath_, errno);
      }
    }
  }
  if (!hiddenPath_.empty()) {
    if (::rename(hiddenPath_.c_str(), finalPath_.c_str()) != 0) {
      Fail("cannot rename the output to", finalPath_, errno);
    }
    hiddenPath_.clear();
    DisarmCleanup();
  }
  const int fd = file_.Release();
  int error = 0;
  if (::close(fd) != 0) error = errno;
  if (error != 0 && error != EINTR) {
    committed_ = true;
    Fail("cannot write output", finalPath_, error);
  }
#endif
  committed_ = true;
}

}  // namespace isortcli

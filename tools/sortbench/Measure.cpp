#include "Measure.h"

#include <cerrno>
#include <chrono>
#include <cstdio>
#include <cstring>
#include <exception>

#ifdef _WIN32
#include <fcntl.h>
#include <io.h>
#include <windows.h>
#include <psapi.h>
#else
#include <fcntl.h>
#include <sys/resource.h>
#include <sys/time.h>
#include <sys/wait.h>
#include <unistd.h>
#endif

namespace sortbench {

void Measurement::Fail(const std::string& why) {
  ok = false;
  std::snprintf(error, sizeof error, "%s", why.c_str());
}

namespace {

void RunBody(const std::function<void(Measurement&)>& body, Measurement& m) {
  try {
    body(m);
  } catch (const std::exception& e) {
    m.Fail(e.what());
  } catch (...) {
    m.Fail("an exception that is not a std::exception (ErrorText?)");
  }
}

}  // namespace

#ifdef _WIN32

Measurement MeasureInChild(const std::function<void(Measurement&)>& body) {
  Measurement m;
  RunBody(body, m);
  PROCESS_MEMORY_COUNTERS counters;
  if (GetProcessMemoryInfo(GetCurrentProcess(), &counters, sizeof counters)) {
    m.peakRssBytes = counters.PeakWorkingSetSize;
  }
  return m;
}

CommandResult MeasureCommand(const std::vector<std::string>&, const std::vector<std::string>&,
                             const std::string&, const std::string&) {
  CommandResult r;
  r.error = "running programs is not supported on this platform";
  return r;
}

std::uint64_t BaselineRssBytes() { return 0; }

int CreateScratchFile(const std::string& directory) {
  for (int attempt = 0; attempt < 100; ++attempt) {
    const std::string path = directory + "\\isortbench-" + std::to_string(GetTickCount() + attempt) + ".tmp";
    int fd = _open(path.c_str(), _O_RDWR | _O_BINARY | _O_CREAT | _O_EXCL | _O_TEMPORARY, 0600);
    if (fd >= 0) return fd;
  }
  return -1;
}

#else

Measurement MeasureInChild(const std::function<void(Measurement&)>& body) {
  Measurement m;
  int fds[2];
  if (::pipe(fds) != 0) {
    m.Fail(std::string("pipe: ") + std::strerror(errno));
    return m;
  }
  std::fflush(nullptr);
  const pid_t pid = ::fork();
  if (pid < 0) {
    ::close(fds[0]);
    ::close(fds[1]);
    m.Fail(std::string("fork: ") + std::strerror(errno));
    return m;
  }
  if (pid == 0) {
    ::close(fds[0]);
    RunBody(body, m);
    const char* p = reinterpret_cast<const char*>(&m);
    std::size_t left = sizeof m;
    while (left > 0) {
      const ssize_t n = ::write(fds[1], p, left);
      if (n <= 0) break;
      p += n;
      left -= static_cast<std::size_t>(n);
    }
    ::_exit(0);
  }
  ::close(fds[1]);
  Measurement got;
  char* p = reinterpret_cast<char*>(&got);
  std::size_t have = 0;
  while (have < sizeof got) {
    const ssize_t n = ::read(fds[0], p + have, sizeof got - have);
    if (n < 0 && errno == EINTR) continue;
    if (n <= 0) break;
    have += static_cast<std::size_t>(n);
  }
  ::close(fds[0]);
  int status = 0;
  struct rusage usage;
  std::memset(&usage, 0, sizeof usage);
  while (::wait4(pid, &status, 0, &usage) < 0 && errno == EINTR) {
  }
  if (have == sizeof got) {
    m = got;
  } else if (WIFSIGNALED(status)) {
    m.Fail("the measurement's process died of signal " + std::to_string(WTERMSIG(status)));
  } else {
    m.Fail("the measurement's process ended without a report");
  }
  m.peakRssBytes = static_cast<std::uint64_t>(usage.ru_maxrss) * 1024;
  return m;
}

CommandResult MeasureCommand(const std::vector<std::string>& argv, const std::vector<std::string>& env,
                             const std::string& stdoutPath, const std::string& stderrPath) {
  CommandResult r;
  std::fflush(nullptr);
  const auto start = std::chrono::steady_clock::now();
  const pid_t pid = ::fork();
  if (pid < 0) {
    r.error = std::string("fork: ") + std::strerror(errno);
    return r;
  }
  if (pid == 0) {
    for (const std::string& e : env) ::putenv(const_cast<char*>(e.c_str()));
    if (!stdoutPath.empty()) {
      const int fd = ::open(stdoutPath.c_str(), O_WRONLY | O_CREAT | O_TRUNC, 0644);
      if (fd < 0 || ::dup2(fd, 1) < 0) ::_exit(126);
      ::close(fd);
    }
    if (!stderrPath.empty()) {
      const int fd = ::open(stderrPath.c_str(), O_WRONLY | O_CREAT | O_TRUNC, 0644);
      if (fd < 0 || ::dup2(fd, 2) < 0) ::_exit(126);
      ::close(fd);
    }
    std::vector<char*> args;
    for (const std::string& a : argv) args.push_back(const_cast<char*>(a.c_str()));
    args.push_back(nullptr);
    ::execvp(args[0], args.data());
    ::_exit(127);
  }
  int status = 0;
  struct rusage usage;
  std::memset(&usage, 0, sizeof usage);
  while (::wait4(pid, &status, 0, &usage) < 0 && errno == EINTR) {
  }
  r.seconds = std::chrono::duration<double>(std::chrono::steady_clock::now() - start).count();
  r.peakRssBytes = static_cast<std::uint64_t>(usage.ru_maxrss) * 1024;
  if (WIFEXITED(status)) {
    r.exitCode = WEXITSTATUS(status);
    if (r.exitCode == 127) r.error = "cannot run '" + argv[0] + "'";
  } else {
    r.error = "'" + argv[0] + "' died of signal " + std::to_string(WTERMSIG(status));
  }
  return r;
}

std::uint64_t BaselineRssBytes() {
  const Measurement m = MeasureInChild([](Measurement& r) { r.ok = true; });
  return m.peakRssBytes;
}

int CreateScratchFile(const std::string& directory) {
  int fd = -1;
#ifdef O_TMPFILE
  fd = ::open(directory.c_str(), O_TMPFILE | O_RDWR | O_CLOEXEC, 0600);
  if (fd >= 0) return fd;
#endif
  std::string pattern = directory + "/isortbench-XXXXXX";
  fd = ::mkstemp(&pattern[0]);
  if (fd >= 0) ::unlink(pattern.c_str());
  return fd;
}

#endif

}  // namespace sortbench

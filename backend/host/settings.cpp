// Process-wide settings of the stand-in host and its report sink.
#include <atomic>
#include <cstdio>
#include <cstdlib>
#include <mutex>
#include <thread>
#include <utility>

#include "hostinternal.h"

#ifdef _WIN32
#include <windows.h>
#endif

namespace vexahost {
namespace {

constexpr unsigned int kDefaultStreamBuffer = 1u << 20;

std::atomic<unsigned int> g_threads{0};
std::atomic<unsigned int> g_packages{0};
std::atomic<unsigned int> g_coresPerPackage{0};
std::atomic<unsigned int> g_streamBuffer{0};
std::atomic<bool> g_caseInsensitive{false};

// The directory and the sink are not atomic types; each has its mutex.
// Both are function-local so they work from other objects' static
// initialisers and destructors.
struct Locked {
  std::mutex mutex;
  std::string tempDirectory;
  ReportSink sink;
};
Locked& State() {
  static Locked* state = new Locked;  // never destroyed: reports may come late
  return *state;
}

std::string DefaultTempDirectory() {
#ifdef _WIN32
  char path[MAX_PATH + 1];
  DWORD n = GetTempPathA(sizeof path, path);
  if (n == 0 || n > MAX_PATH) return ".";
  std::string dir(path, n);
  while (dir.size() > 3 && (dir.back() == '\\' || dir.back() == '/')) dir.pop_back();
  return dir;
#else
  const char* env = std::getenv("TMPDIR");
  if (env && *env) return env;
  return "/tmp";
#endif
}

}  // namespace

void SetThreadSetting(unsigned int threads) { g_threads.store(threads, std::memory_order_relaxed); }

void SetProcessorCounts(unsigned int packages, unsigned int coresPerPackage) {
  g_packages.store(packages, std::memory_order_relaxed);
  g_coresPerPackage.store(coresPerPackage, std::memory_order_relaxed);
}

void SetTempDirectory(const std::string& directory) {
  Locked& s = State();
  std::lock_guard<std::mutex> lock(s.mutex);
  s.tempDirectory = directory;
}

std::string TempDirectory() {
  {
    Locked& s = State();
    std::lock_guard<std::mutex> lock(s.mutex);
    if (!s.tempDirectory.empty()) return s.tempDirectory;
  }
  return DefaultTempDirectory();
}

void SetStreamBufferSize(unsigned int bytes) {
  g_streamBuffer.store(bytes, std::memory_order_relaxed);
}

unsigned int StreamBufferSize() {
  unsigned int bytes = g_streamBuffer.load(std::memory_order_relaxed);
  return bytes ? bytes : kDefaultStreamBuffer;
}

void SetReportSink(ReportSink sink) {
  Locked& s = State();
  std::lock_guard<std::mutex> lock(s.mutex);
  s.sink = std::move(sink);
}

void SetCaseInsensitiveCollation(bool on) {
  g_caseInsensitive.store(on, std::memory_order_relaxed);
}

namespace internal {

unsigned int ThreadSetting() {
  unsigned int threads = g_threads.load(std::memory_order_relaxed);
  if (threads) return threads;
  threads = std::thread::hardware_concurrency();
  return threads ? threads : 1;
}

void ProcessorCountSetting(unsigned int* packages, unsigned int* coresPerPackage) {
  *packages = g_packages.load(std::memory_order_relaxed);
  *coresPerPackage = g_coresPerPackage.load(std::memory_order_relaxed);
}

bool CaseInsensitiveCollation() { return g_caseInsensitive.load(std::memory_order_relaxed); }

void Report(const std::string& message) noexcept {
  try {
    ReportSink sink;
    {
      Locked& s = State();
      std::lock_guard<std::mutex> lock(s.mutex);
      sink = s.sink;
    }
    // Called outside the lock, so a sink may itself change settings.
    if (sink) {
      sink(message);
      return;
    }
  } catch (...) {
    // A sink that fails must not take the reporting code down with it;
    // the report then goes to standard error.
  }
  std::fprintf(stderr, "%s\n", message.c_str());
  std::fflush(stderr);
}

}  // namespace internal
}  // namespace vexahost

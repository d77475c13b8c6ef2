// Settings of the stand-in host that tests, tools and benchmarks may change.
// Not part of the host's interface to the sort: the sort never includes this.
//
// Settings are process-wide; set them before a sort starts, not during one.
#pragma once

#include <functional>
#include <string>

#include "isort/host/vexatypes.h"

namespace vexahost {

// The thread setting GETTHREADS() returns; 0 restores the default (the
// hardware's thread count).
VEXAHOST_API void SetThreadSetting(unsigned int threads);

// Processor packages and cores per package that getPhysicalCPUCount() and
// getCoresPerPhysicalCPUCount() return; 0 restores the operating system's.
VEXAHOST_API void SetProcessorCounts(unsigned int packages, unsigned int coresPerPackage);

// Directory of temporary files; empty restores the default (TMPDIR, else /tmp;
// on Windows the system's temporary directory).
VEXAHOST_API void SetTempDirectory(const std::string& directory);
VEXAHOST_API std::string TempDirectory();

// Buffer size of each file stream object, which is also VEXA_TempFile's
// Footprint(); 0 restores the default (1 MiB).
VEXAHOST_API void SetStreamBufferSize(unsigned int bytes);
VEXAHOST_API unsigned int StreamBufferSize();

// Where reports go (Reporter, VexaErrorMonitor, ASSERT, VexaRuntimeAssert):
// one call per report with its full text. An empty function restores the
// default, a line on standard error.
typedef std::function<void(const std::string& message)> ReportSink;
VEXAHOST_API void SetReportSink(ReportSink sink);

// Collation that VEXAMBCollator::Init() chooses: false (default) plain
// unsigned byte order, true ASCII letters compared without case.
VEXAHOST_API void SetCaseInsensitiveCollation(bool on);

// The system-missing value held in the global common block: -DBL_MAX.
VEXAHOST_API const OBS* SystemMissing();

}  // namespace vexahost

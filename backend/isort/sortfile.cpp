// SORTFILE: a whole FileSort sort behind one Fortran-callable function, with
// exceptions turned into return codes.
#include "sortfile.h"

#include <cstddef>
#include <new>
#include <stdexcept>

#include "FileSortInternal.h"
#include "isort/host/errhub.h"
#include "isort/host/rtassert.h"
#include "isort/host/vexawdat.h"

void MakeCSortKeys(const FortranInt* ukeys, unsigned int n, std::vector<FileSort::SortKey>& keys) {
  keys.reserve(keys.size() + n);
  const std::size_t count = n;
  for (std::size_t i = 0; i < count; ++i) {
    FileSort::SortKey key;
    key.variable = ukeys[i] - 1;
    key.direction = ukeys[count + i] > 0 ? 1 : -1;
    key.width = static_cast<std::uint32_t>(ukeys[2 * count + i]);
    keys.push_back(key);
  }
}

SortFileSorter::SortFileSorter(void* c, InputFunction in, OutputFunction out, FortranInt n,
                               const std::vector<FileSort::SortKey>& keys)
    : FileSort(keys, static_cast<std::uint32_t>(n), nullptr),
      context(c),
      input(in),
      output(out),
      nvars(n),
      // A width whose byte count does not fit in 32 bits fails here, on every
      // platform, rather than yielding a short buffer.
      buffer(new OBS[CheckedBytes(static_cast<std::uint32_t>(n), sizeof(OBS)) / sizeof(OBS)]),
      outputResult(0) {}

SortFileSorter::~SortFileSorter() { delete[] buffer; }

const OBS* SortFileSorter::GetRecord() {
  return input(context, buffer, &nvars) == 0 ? buffer : nullptr;
}

void SortFileSorter::PutRecord(const OBS* record) {
  outputResult = output(context, record, &nvars);
  if (outputResult != 0) throw Error();
}

namespace {

// Sets the caller's two result words to 0 however SORTFILE is left.
class ZeroOnExit {
 public:
  ZeroOnExit(FortranInt* a, FortranInt* b) : a_(a), b_(b) {}
  ~ZeroOnExit() {
    if (a_) *a_ = 0;
    if (b_) *b_ = 0;
  }
  ZeroOnExit(const ZeroOnExit&) = delete;
  ZeroOnExit& operator=(const ZeroOnExit&) = delete;

 private:
  FortranInt* a_;
  FortranInt* b_;
};

FortranInt ReportError(const ErrorText& error) {
  try {
    VexaErrorMonitor monitor(Reporter);
    monitor.Report(error);
  } catch (const std::bad_alloc&) {
    // The copy for the report could not be made: nothing reached the host.
    return kSortFileNoMemory;
  }
  return kSortFileReported;
}

}  // namespace

FortranInt VEXA_STDCALL SORTFILE(void* context, SortFileSorter::InputFunction input,
                                 SortFileSorter::OutputFunction output, const FortranInt* nvars,
                                 const FortranInt* ukeys, const FortranInt* nukeys, const void*,
                                 const void*, const void*, FortranInt* zero10, FortranInt* zero11) {
  ZeroOnExit zero(zero10, zero11);

  // Each failed precondition is reported; then the call ends, because going
  // on would hand the sort a record width or key array it cannot use.
  bool usable = true;
  if (!nvars || *nvars <= 0) {
    VexaRuntimeAssert(L"nvars", L"backend/isort/sortfile.cpp", __LINE__);
    usable = false;
  }
  if (!nukeys || *nukeys <= 0) {
    VexaRuntimeAssert(L"nukeys", L"backend/isort/sortfile.cpp", __LINE__);
    usable = false;
  }
  if (!ukeys) {
    VexaRuntimeAssert(L"ukeys", L"backend/isort/sortfile.cpp", __LINE__);
    usable = false;
  }
  if (!usable) return kSortFileReported;

  std::vector<FileSort::SortKey> keys;
  try {
    MakeCSortKeys(ukeys, static_cast<unsigned int>(*nukeys), keys);
  } catch (const std::bad_alloc&) {
    return kSortFileNoMemory;
  } catch (const std::length_error&) {
    return kSortFileNoMemory;  // more keys than a vector can hold: memory by another name
  }

  FortranInt code = kSortFileDone;
  try {
    SortFileSorter sorter(context, input, output, *nvars, keys);
    try {
      sorter.Sort();
    } catch (const SortFileSorter::Error&) {
      // The output function stopped the sort; its value is the code.
    }
    code = sorter.OutputResult();
  } catch (const std::bad_alloc&) {
    code = kSortFileNoMemory;
  } catch (const ErrorText& error) {
    code = ReportError(error);
  } catch (const VexaGoToCaller&) {
    code = kSortFileGoToCaller;
  }
  return code;
}

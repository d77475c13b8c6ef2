// SORTFILE on arbitrary key arrays, record widths and small record sets,
// and the same sorts through FileSort with a memory target of a few hundred
// bytes, so that random key sets also go through many runs and merge passes.
//
// Input: a byte of settings (which way, and for FileSort the memory target,
// stream buffer and workers), the record width, the key count and each
// key's variable, direction and width (around the valid ranges), the record
// count, then the records' values drawn from a small pool (ties, both zeros,
// infinities, NaNs, text, the system-missing value). Nothing may crash.
// SORTFILE returns 5 exactly when a precondition fails or a key lies outside
// the record (FileSort's constructor then throws ErrorText), and otherwise 0
// with every record delivered once, bit for bit: in the stable order of its
// keys when no numeric key holds a NaN (a NaN has no order).
#include <algorithm>
#include <cstdint>
#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <string>
#include <vector>

#include "FileSortInternal.h"
#include "host/hostsettings.h"
#include "isort/host/errhub.h"
#include "isort/sortfile.h"

#include "fuzz_input.h"

namespace {

[[noreturn]] void Fail(const char* what) { fuzzing::Fail("SORTFILE", what); }

struct Context {
  FortranInt nvars;
  const std::vector<OBS>* input;
  std::size_t next = 0;
  std::vector<OBS> output;
};

FortranInt VEXA_STDCALL Input(void* c, OBS* buffer, FortranInt* nvars) {
  Context& context = *static_cast<Context*>(c);
  if (*nvars != context.nvars) Fail("input function got another width");
  const std::size_t n = static_cast<std::size_t>(context.nvars);
  if (context.next * n >= context.input->size()) return 1;
  std::memcpy(buffer, context.input->data() + context.next * n, n * sizeof(OBS));
  ++context.next;
  return 0;
}

FortranInt VEXA_STDCALL Output(void* c, const OBS* record, FortranInt* nvars) {
  Context& context = *static_cast<Context*>(c);
  if (*nvars != context.nvars) Fail("output function got another width");
  context.output.insert(context.output.end(), record, record + context.nvars);
  return 0;
}

struct Key {
  std::int64_t variable;  // 0-based
  int direction;
  std::uint32_t width;
};

std::uint64_t Bits(const OBS* v) {
  std::uint64_t b;
  std::memcpy(&b, v, sizeof b);
  return b;
}

bool IsNan(const OBS* v) {
  const std::uint64_t b = Bits(v);
  return (b & 0x7FF0000000000000ull) == 0x7FF0000000000000ull && (b & 0x000FFFFFFFFFFFFFull);
}

int Compare(const OBS* a, const OBS* b, const std::vector<Key>& keys) {
  for (const Key& k : keys) {
    int r;
    if (k.width == 0) {
      double x, y;
      std::memcpy(&x, a + k.variable, 8);
      std::memcpy(&y, b + k.variable, 8);
      r = x < y ? -1 : x > y ? 1 : 0;
    } else {
      r = std::memcmp(a + k.variable, b + k.variable, k.width);
      r = r < 0 ? -1 : r > 0 ? 1 : 0;
    }
    if (r) return r * k.direction;
  }
  return 0;
}

// The same callbacks behind FileSort.
class ContextSort : public FileSort {
 public:
  ContextSort(const std::vector<FileSort::SortKey>& keys, unsigned nvars, Context& context)
      : FileSort(keys, nvars, nullptr), context_(context) {}
  const OBS* GetRecord() override {
    return Input(&context_, buffer_.data(), &context_.nvars) == 0 ? buffer_.data() : nullptr;
  }
  void PutRecord(const OBS* record) override { Output(&context_, record, &context_.nvars); }

 private:
  Context& context_;
  std::vector<OBS> buffer_ = std::vector<OBS>(static_cast<std::size_t>(context_.nvars));
};

void UseWorkers(unsigned n) {
  vexahost::SetThreadSetting(n);
  vexahost::SetProcessorCounts(1, n);
}

}  // namespace

extern "C" int LLVMFuzzerTestOneInput(const std::uint8_t* data, std::size_t size) {
  static const bool quiet = (vexahost::SetReportSink([](const std::string&) {}), true);
  (void)quiet;
  fuzzing::Reader in(data, size);
  const std::uint8_t settings = in.Byte();
  const bool viaFileSort = settings & 1;
  const FortranInt nvars = static_cast<FortranInt>(in.Byte() % 14) - 1;  // -1 to 12
  const FortranInt nukeys = static_cast<FortranInt>(in.Byte() % 6) - 1;  // -1 to 4
  const std::size_t n = nukeys > 0 ? static_cast<std::size_t>(nukeys) : 0;
  std::vector<FortranInt> ukeys(3 * n + 1);
  std::vector<Key> keys;
  bool accepted = nvars > 0 && nukeys > 0;
  for (std::size_t i = 0; i < n; ++i) {
    const FortranInt variable = static_cast<FortranInt>(in.Byte() % 16) - 1;
    const FortranInt direction = static_cast<FortranInt>(in.Byte() % 5) - 2;
    const std::uint8_t w = in.Byte();
    const FortranInt width = w < 240 ? static_cast<FortranInt>(w % 34) - 1
                                     : static_cast<FortranInt>(0x7FFFFFF8u + w % 16);
    ukeys[i] = variable;
    ukeys[n + i] = direction;
    ukeys[2 * n + i] = width;
    const std::uint32_t bytes = static_cast<std::uint32_t>(width);
    const std::uint64_t step = bytes <= 8 ? 1 : (std::uint64_t{bytes} + 7) / 8;
    accepted =
        accepted && variable >= 1 && variable - 1 + step <= static_cast<std::uint64_t>(nvars);
    keys.push_back({variable - 1, direction > 0 ? 1 : -1, bytes});
  }
  const std::size_t records = in.Byte() % 65;
  const std::size_t width = nvars > 0 ? static_cast<std::size_t>(nvars) : 0;

  const std::uint64_t pool[] = {0x0000000000000000ull, 0x8000000000000000ull, 0x3FF0000000000000ull,
                                0xBFF0000000000000ull, 0x7FF0000000000000ull, 0xFFF0000000000000ull,
                                0x7FF8000000000000ull, 0x7FF0000000000001ull, 0xFFEFFFFFFFFFFFFFull,
                                0x2020202020202020ull, 0x4141414141414141ull, 0x4142434420202020ull,
                                0x00FF00FF00FF00FFull};
  std::vector<OBS> input(records * width);
  for (OBS& v : input) {
    const std::uint8_t b = in.Byte();
    const std::uint64_t bits = b < 208 ? pool[b % 13] : 0x4000000000000000ull | b;
    std::memcpy(&v, &bits, sizeof v);
  }
  for (std::size_t r = 0; r < records; ++r) {  // record r holds its number in its last value
    if (width > 1) input[r * width + width - 1] = static_cast<double>(r);
  }

  Context context{nvars, &input, 0, {}};
  if (viaFileSort) {
    if (nvars <= 0 || nukeys <= 0) return 0;  // SORTFILE's preconditions
    std::vector<FileSort::SortKey> sortKeys;
    MakeCSortKeys(ukeys.data(), static_cast<unsigned>(nukeys), sortKeys);
    UseWorkers(1 + (settings >> 1) % 3);
    vexahost::SetStreamBufferSize(64u << ((settings >> 3) % 5));
    try {
      ContextSort sort(sortKeys, static_cast<unsigned>(nvars), context);
      if (!accepted) Fail("FileSort took keys outside the record");
      FileSortAccess::DataOf(sort).memoryTarget = 128u << ((settings >> 5) % 6);
      sort.Sort();
    } catch (const ErrorText&) {
      if (accepted || context.next != 0) Fail("ErrorText from a sort with usable keys");
      return 0;
    }
  } else {
    // Many workers keep each one's share of the 100 MiB target, for which
    // its batch buffer is sized, small.
    UseWorkers(16);
    vexahost::SetStreamBufferSize(0);
    FortranInt a10 = 1, a11 = 1;
    const FortranInt code = SORTFILE(&context, Input, Output, &nvars, n ? ukeys.data() : nullptr,
                                     &nukeys, nullptr, nullptr, nullptr, &a10, &a11);
    if (a10 != 0 || a11 != 0) Fail("arguments 10 and 11");
    if (!accepted) {
      if (code != 5) Fail("rejected keys did not give 5");
      if (!context.output.empty() || context.next != 0) Fail("rejected keys called back");
      return 0;
    }
    if (code != 0) Fail("accepted keys did not give 0");
  }
  if (context.output.size() != input.size()) Fail("records lost or added");

  bool orderable = true;
  for (std::size_t r = 0; r < records && orderable; ++r) {
    for (const Key& k : keys) {
      if (k.width == 0 && IsNan(&input[r * width + k.variable])) orderable = false;
    }
  }
  if (orderable) {
    std::vector<std::size_t> order(records);
    for (std::size_t i = 0; i < records; ++i) order[i] = i;
    std::stable_sort(order.begin(), order.end(), [&](std::size_t x, std::size_t y) {
      return Compare(&input[x * width], &input[y * width], keys) < 0;
    });
    for (std::size_t i = 0; i < records; ++i) {
      if (std::memcmp(&context.output[i * width], &input[order[i] * width], width * sizeof(OBS)))
        Fail("order");
    }
  } else if (width > 1) {
    std::vector<char> seen(records, 0);
    for (std::size_t i = 0; i < records; ++i) {
      const double id = context.output[i * width + width - 1];
      const std::size_t k = static_cast<std::size_t>(id);
      if (!(id >= 0 && id < static_cast<double>(records)) || seen[k]++ ||
          std::memcmp(&context.output[i * width], &input[k * width], width * sizeof(OBS)))
        Fail("records of NaN keys");
    }
  }
  return 0;
}

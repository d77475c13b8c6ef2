// sortfilebench: the Fortran-callable path beside the C++ one, in one run.
//
// Wide cases of the W2 workload (a 12-byte string key ascending, then a
// double descending) are sorted twice, each in a process of its own:
//   FileSort   the cases themselves, through GetRecord/PutRecord;
//   SORTFILE   packed sort records: SRTFVA builds the map and key list once,
//              the input function packs each case (SRTFPK, rest compressed),
//              SORTFILE sorts by the key triples SRTFVA returned, and the
//              output function unpacks each record again (SRTFUP).
// Both feed the same consumer, which checks order, stability and checksum.
//
//   sortfilebench [--records N] [--values N] [--threads N]
#include <chrono>
#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <string>
#include <vector>

#include "Measure.h"
#include "Workloads.h"
#include "host/hostsettings.h"
#include "isort/sortfile.h"

using namespace sortbench;

namespace {

struct Options {
  std::uint64_t records = 2000000;
  unsigned values = 40;
  unsigned threads = 2;
};

// The keys as the Fortran entries take them: 1-based variables,
// directions, widths, in three blocks.
std::vector<FortranInt> FortranKeys(const std::vector<FileSort::SortKey>& keys) {
  const std::size_t n = keys.size();
  std::vector<FortranInt> u(3 * n);
  for (std::size_t i = 0; i < n; ++i) {
    u[i] = keys[i].variable + 1;
    u[n + i] = keys[i].direction;
    u[2 * n + i] = static_cast<FortranInt>(keys[i].width);
  }
  return u;
}

class CaseSort : public FileSort {
 public:
  CaseSort(const RecordGenerator& g, std::uint64_t n, OrderChecker& out,
           const std::vector<SortKey>& keys)
      : FileSort(keys, g.Nvars(), nullptr), gen_(g), n_(n), out_(out), record_(g.Nvars()) {}
  const OBS* GetRecord() override {
    if (next_ == n_) return nullptr;
    gen_.Make(next_++, record_.data());
    return record_.data();
  }
  void PutRecord(const OBS* record) override { out_.Put(record); }

 private:
  const RecordGenerator& gen_;
  std::uint64_t n_, next_ = 0;
  OrderChecker& out_;
  std::vector<OBS> record_;
};

// What SORTFILE's two callback functions share.
struct Packing {
  const RecordGenerator* gen;
  std::uint64_t n, next = 0;
  OrderChecker* out;
  std::vector<OBS> caseValues;
  std::vector<FortranInt> map, keyList;
  FortranInt nmap = 0, nkeypairs = 0, header = 0, compress = 1;
  std::size_t packedValues = 0;
};

FortranInt VEXA_STDCALL PackNext(void* context, OBS* buffer, FortranInt*) {
  Packing& p = *static_cast<Packing*>(context);
  if (p.next == p.n) return 1;
  p.gen->Make(p.next++, p.caseValues.data());
  SRTFPK(p.caseValues.data(), reinterpret_cast<FortranInt*>(buffer), &p.header, p.map.data(),
         p.keyList.data(), &p.nmap, &p.nkeypairs, &p.compress);
  // Bytes past the packed length are left from earlier records: clear them.
  FortranInt words;
  std::memcpy(&words, buffer, sizeof words);
  const std::size_t used = static_cast<std::size_t>(words) * 4;
  std::memset(reinterpret_cast<char*>(buffer) + used, 0, p.packedValues * 8 - used);
  return 0;
}

FortranInt VEXA_STDCALL UnpackNext(void* context, const OBS* record, FortranInt*) {
  Packing& p = *static_cast<Packing*>(context);
  // SRTFUP restores string keys in place, so it works on a copy.
  static thread_local std::vector<OBS> copy;
  copy.assign(record, record + p.packedValues);
  SRTFUP(reinterpret_cast<FortranInt*>(copy.data()), p.caseValues.data(), p.map.data(),
         p.keyList.data(), &p.nmap, &p.nkeypairs, &p.compress);
  p.out->Put(p.caseValues.data());
  return 0;
}

void Finish(Measurement& m, const OrderChecker& out, std::uint64_t checksumIn) {
  m.records = out.Count();
  m.checksumIn = checksumIn;
  m.checksumOut = out.Checksum();
  m.orderViolations = out.OrderViolations();
  m.stabilityViolations = out.StabilityViolations();
}

double Seconds(std::chrono::steady_clock::time_point since) {
  return std::chrono::duration<double>(std::chrono::steady_clock::now() - since).count();
}

}  // namespace

int main(int argc, char** argv) {
  Options o;
  for (int i = 1; i + 1 < argc; i += 2) {
    const std::string a = argv[i];
    const unsigned long long v = std::strtoull(argv[i + 1], nullptr, 10);
    if (a == "--records") o.records = v;
    else if (a == "--values") o.values = static_cast<unsigned>(v);
    else if (a == "--threads") o.threads = static_cast<unsigned>(v);
    else {
      std::fprintf(stderr, "usage: sortfilebench [--records N] [--values N] [--threads N]\n");
      return 2;
    }
  }
  const std::vector<FileSort::SortKey> keys = WorkloadKeys(Workload::W2);
  const RecordGenerator gen(Workload::W2, o.values);
  std::uint64_t checksumIn = 0;
  {
    std::vector<OBS> r(o.values);
    for (std::uint64_t i = 0; i < o.records; ++i) {
      gen.Make(i, r.data());
      checksumIn += RecordHash(r.data(), o.values);
    }
  }
  vexahost::SetProcessorCounts(1, o.threads);
  vexahost::SetThreadSetting(o.threads);
  std::printf("%llu cases of %u values (W2 keys), %u threads, default memory target\n",
              static_cast<unsigned long long>(o.records), o.values, o.threads);

  const Measurement plain = MeasureInChild([&](Measurement& m) {
    OrderChecker out(keys, o.values);
    const auto start = std::chrono::steady_clock::now();
    CaseSort sort(gen, o.records, out, keys);
    sort.Sort();
    m.seconds = Seconds(start);
    Finish(m, out, checksumIn);
    m.ok = true;
  });

  FortranInt keylength = 0;
  const Measurement packed = MeasureInChild([&](Measurement& m) {
    OrderChecker out(keys, o.values);
    const auto start = std::chrono::steady_clock::now();
    Packing p;
    p.gen = &gen;
    p.n = o.records;
    p.out = &out;
    p.caseValues.resize(o.values);
    std::vector<FortranInt> ukeys = FortranKeys(keys);
    FortranInt n = static_cast<FortranInt>(keys.size()), widraw = static_cast<FortranInt>(o.values);
    FortranInt pack = 1, fill = 0;
    if (SRTFVA(&n, ukeys.data(), nullptr, nullptr, &p.nmap, &p.nkeypairs, &keylength, &widraw,
               &pack, &fill) != 0) {
      m.Fail("SRTFVA rejected the keys");
      return;
    }
    p.map.resize(2 * static_cast<std::size_t>(p.nmap));
    p.keyList.resize(3 * (keys.size() + 1));
    fill = 1;
    SRTFVA(&n, ukeys.data(), p.keyList.data(), p.map.data(), &p.nmap, &p.nkeypairs, &keylength,
           &widraw, &pack, &fill);
    // Header, every value uncompressed at worst, and a control block per group.
    const std::size_t rest = o.values - static_cast<std::size_t>(keylength);
    p.packedValues = 1 + static_cast<std::size_t>(keylength) + rest + (rest + 7) / 8;
    // SORTFILE's keys: the triples' offsets count the header as value 0.
    std::vector<FortranInt> sortKeys(3 * keys.size());
    for (std::size_t i = 0; i < keys.size(); ++i) {
      sortKeys[i] = p.keyList[3 * i] + 1;
      sortKeys[keys.size() + i] = p.keyList[3 * i + 2];
      sortKeys[2 * keys.size() + i] = p.keyList[3 * i + 1];
    }
    FortranInt nvars = static_cast<FortranInt>(p.packedValues), zero10 = 1, zero11 = 1;
    const FortranInt code = SORTFILE(&p, PackNext, UnpackNext, &nvars, sortKeys.data(), &n,
                                     nullptr, nullptr, nullptr, &zero10, &zero11);
    m.seconds = Seconds(start);
    if (code != 0) {
      m.Fail("SORTFILE returned " + std::to_string(code));
      return;
    }
    Finish(m, out, checksumIn);
    m.ok = true;
  });

  auto line = [&](const char* name, const Measurement& m) {
    const bool right = m.ok && m.records == o.records && m.checksumOut == m.checksumIn &&
                       m.orderViolations == 0 && m.stabilityViolations == 0;
    std::printf("  %-28s %7.2f s  %6.2f Mcases/s  peak RSS %6.1f MiB  %s\n", name, m.seconds,
                m.seconds > 0 ? o.records / m.seconds / 1e6 : 0.0, m.peakRssBytes / 1048576.0,
                right ? "output checked" : (m.ok ? "OUTPUT WRONG" : m.error));
    return right;
  };
  const bool ok = line("FileSort, unpacked cases", plain) & line("SORTFILE, packed records", packed);
  if (plain.ok && packed.ok) std::printf("  SORTFILE / FileSort  %.2f\n", packed.seconds / plain.seconds);
  return ok ? 0 : 1;
}

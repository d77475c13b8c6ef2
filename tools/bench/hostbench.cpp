// hostbench: throughput of the host's record codec and temporary files.
//
// Workloads (sizes in MiB of uncompressed values unless stated):
//   codec   For three record kinds, 40-value records filling --codec-mib:
//             doubles   random bit patterns: every value a literal
//             integers  integers from -99 to 151: every value a one-byte code
//             strings   a 32-byte text field in 4 values, 1 to 12 letters then
//                       blanks, twice per record, other values small integers
//           encode: WriteCompressed of every record into a memory stream;
//           decode: ReadCompressed of them all back. Baseline: memcpy of the
//           same uncompressed bytes, record by record.
//   files   --file-mib written to a VEXA_TempFile in --chunk-kib Write calls,
//           then read back the same way. Baseline: the same bytes written
//           to and read from an unbuffered C stream in the same directory.
// Each figure is the best of --repeat runs; ratios are host / baseline.
//
// Usage: hostbench [--codec-mib N] [--file-mib N] [--chunk-kib N] [--repeat N]
#include <algorithm>
#include <chrono>
#include <cstdint>
#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <functional>
#include <random>
#include <string>
#include <vector>

#include "host/hostsettings.h"
#include "isort/host/iostore.h"
#include "isort/host/vexawcom.h"

namespace {

using Clock = std::chrono::steady_clock;

double Seconds(const std::function<void()>& run, int repeat) {
  double best = 1e300;
  for (int i = 0; i < repeat; ++i) {
    const auto start = Clock::now();
    run();
    best = std::min(best, std::chrono::duration<double>(Clock::now() - start).count());
  }
  return best;
}

double MiBPerSecond(std::size_t bytes, double seconds) {
  return static_cast<double>(bytes) / (1024.0 * 1024.0) / seconds;
}

constexpr std::size_t kRecordValues = 40;

OBS FromBits(std::uint64_t bits) {
  OBS v;
  std::memcpy(&v, &bits, 8);
  return v;
}

std::vector<OBS> MakeValues(const std::string& kind, std::size_t records, std::mt19937_64& rng) {
  std::vector<OBS> values(records * kRecordValues);
  for (std::size_t r = 0; r < records; ++r) {
    OBS* record = values.data() + r * kRecordValues;
    for (std::size_t i = 0; i < kRecordValues; ++i) {
      if (kind == "doubles") {
        // Random finite doubles of every magnitude.
        std::uint64_t bits = rng();
        if (((bits >> 52) & 0x7FF) == 0x7FF) bits ^= 1ull << 62;
        record[i] = FromBits(bits);
      } else {
        record[i] = static_cast<double>(static_cast<int>(rng() % 251) - 99);
      }
    }
    if (kind == "strings") {
      for (std::size_t field : {4u, 20u}) {
        char text[32];
        std::memset(text, ' ', sizeof text);
        for (std::size_t c = 0, n = 1 + rng() % 12; c < n; ++c) text[c] = static_cast<char>('a' + rng() % 26);
        std::memcpy(record + field, text, sizeof text);
      }
    }
  }
  return values;
}

struct Result {
  double host;
  double baseline;
};

void PrintRow(const std::string& what, const Result& r, const char* baselineName) {
  std::printf("%-26s %10.1f MiB/s   %-14s %10.1f MiB/s   ratio %5.2f\n", what.c_str(), r.host,
              baselineName, r.baseline, r.host / r.baseline);
}

void BenchCodec(const std::string& kind, std::size_t mib, int repeat) {
  std::mt19937_64 rng(12345);
  const std::size_t records = mib * 1024 * 1024 / (kRecordValues * 8);
  const std::vector<OBS> values = MakeValues(kind, records, rng);
  const std::size_t bytes = values.size() * 8;

  VEXA_InMemoryFile stream(static_cast<unsigned int>(VEXA_CompressedBound(values.size())));
  const double encode = Seconds([&] {
    stream.Seek(0, VEXA_StrBaseIO::SeekBegin);
    for (std::size_t r = 0; r < records; ++r)
      WriteCompressed(stream, values.data() + r * kRecordValues, kRecordValues);
  }, repeat);
  const std::int64_t encoded = stream.Tell();

  std::vector<OBS> back(values.size());
  bool ok = true;
  const double decode = Seconds([&] {
    stream.Seek(0, VEXA_StrBaseIO::SeekBegin);
    for (std::size_t r = 0; r < records; ++r)
      ok &= ReadCompressed(stream, back.data() + r * kRecordValues, kRecordValues);
  }, repeat);
  if (!ok || std::memcmp(values.data(), back.data(), bytes) != 0) {
    std::fprintf(stderr, "hostbench: %s records did not round-trip\n", kind.c_str());
    std::exit(1);
  }

  std::vector<OBS> copy(values.size());
  const double copyTime = Seconds([&] {
    for (std::size_t r = 0; r < records; ++r)
      std::memcpy(copy.data() + r * kRecordValues, values.data() + r * kRecordValues, kRecordValues * 8);
  }, repeat);
  volatile double keep = copy[copy.size() / 2];
  (void)keep;

  const double baseline = MiBPerSecond(bytes, copyTime);
  std::printf("codec %-8s %zu MiB, encoded to %.1f%% of its size\n", kind.c_str(), bytes >> 20,
              100.0 * static_cast<double>(encoded) / static_cast<double>(bytes));
  PrintRow("  encode (WriteCompressed)", {MiBPerSecond(bytes, encode), baseline}, "memcpy");
  PrintRow("  decode (ReadCompressed)", {MiBPerSecond(bytes, decode), baseline}, "memcpy");
}

void BenchFiles(std::size_t mib, std::size_t chunkKiB, int repeat) {
  const std::size_t chunk = chunkKiB * 1024;
  const std::size_t chunks = mib * 1024 * 1024 / chunk;
  const std::size_t bytes = chunks * chunk;
  std::vector<unsigned char> data(chunk), in(chunk);
  std::mt19937 rng(1);
  for (unsigned char& c : data) c = static_cast<unsigned char>(rng());

  double hostWrite = 1e300, hostRead = 1e300, rawWrite = 1e300, rawRead = 1e300;
  const std::string rawName = vexahost::TempDirectory() + "/hostbench-raw.tmp";
  for (int i = 0; i < repeat; ++i) {
    {
      VEXA_TempFile file("sort", true);
      hostWrite = std::min(hostWrite, Seconds([&] {
        for (std::size_t c = 0; c < chunks; ++c) file.Write(data.data(), static_cast<unsigned int>(chunk));
        file.Flush();
      }, 1));
      hostRead = std::min(hostRead, Seconds([&] {
        file.Seek(0, VEXA_StrBaseIO::SeekBegin);
        for (std::size_t c = 0; c < chunks; ++c) file.Read(in.data(), static_cast<unsigned int>(chunk));
      }, 1));
    }
    std::FILE* raw = std::fopen(rawName.c_str(), "w+b");
    if (!raw) {
      std::perror(rawName.c_str());
      std::exit(1);
    }
    std::setvbuf(raw, nullptr, _IONBF, 0);
    rawWrite = std::min(rawWrite, Seconds([&] {
      for (std::size_t c = 0; c < chunks; ++c) std::fwrite(data.data(), 1, chunk, raw);
      std::fflush(raw);
    }, 1));
    rawRead = std::min(rawRead, Seconds([&] {
      std::fseek(raw, 0, SEEK_SET);
      for (std::size_t c = 0; c < chunks; ++c)
        if (std::fread(in.data(), 1, chunk, raw) != chunk) std::exit(1);
    }, 1));
    std::fclose(raw);
    std::remove(rawName.c_str());
  }
  std::printf("temporary file %zu MiB in %zu KiB transfers (buffer %u KiB), in %s\n", bytes >> 20,
              chunkKiB, vexahost::StreamBufferSize() / 1024, vexahost::TempDirectory().c_str());
  PrintRow("  sequential write", {MiBPerSecond(bytes, hostWrite), MiBPerSecond(bytes, rawWrite)},
           "raw write");
  PrintRow("  sequential read", {MiBPerSecond(bytes, hostRead), MiBPerSecond(bytes, rawRead)},
           "raw read");
}

}  // namespace

int main(int argc, char** argv) {
  std::size_t codecMiB = 256, fileMiB = 512, chunkKiB = 4096;
  int repeat = 3;
  for (int i = 1; i + 1 < argc; i += 2) {
    const std::string option = argv[i];
    const long value = std::atol(argv[i + 1]);
    if (value <= 0) {
      std::fprintf(stderr, "hostbench: %s needs a positive number\n", option.c_str());
      return 2;
    }
    if (option == "--codec-mib") codecMiB = static_cast<std::size_t>(value);
    else if (option == "--file-mib") fileMiB = static_cast<std::size_t>(value);
    else if (option == "--chunk-kib") chunkKiB = static_cast<std::size_t>(value);
    else if (option == "--repeat") repeat = static_cast<int>(value);
    else {
      std::fprintf(stderr, "usage: hostbench [--codec-mib N] [--file-mib N] [--chunk-kib N] [--repeat N]\n");
      return 2;
    }
  }
  for (const char* kind : {"doubles", "integers", "strings"}) BenchCodec(kind, codecMiB, repeat);
  BenchFiles(fileMiB, chunkKiB, repeat);
  BenchFiles(fileMiB, 64, repeat);
  return 0;
}

// Numeric keys full of NaNs (quiet and signaling, either sign, any payload),
// infinities and -0.0, on every path: a single batch, several runs merged in
// one pass, several merge passes, one and three workers, and SORTFILE in
// memory and spilled. A NaN compares equal to everything, so there is no
// order to check; what must hold is that every record comes out exactly
// once, bit for bit, and that the sort ends. Without NaNs (infinities and
// both zeros only) the order is the oracle's, -0.0 tying with +0.0.
#include <gtest/gtest.h>

#include <cstdio>

#include "fault_harness.h"
#include "host/hostsettings.h"

namespace faults {
namespace {

using testing_support::Bits;
using testing_support::FromBits;

enum Mix { kAllNan, kNanAndOthers, kNoNan };
const char* const kMixNames[] = {"all NaN", "NaN among others", "no NaN"};

const std::vector<Key> kKeySets[] = {
    {{0, 1, 0}}, {{0, -1, 0}}, {{0, 1, 0}, {2, -1, 0}}, {{2, -1, 0}, {3, 1, 8}, {0, 1, 0}}};

// Records of four values: two numeric keys' values, the input position, and
// a text value.
Records NanRecords(std::size_t count, Mix mix, int keySet, std::uint64_t seed) {
  static const std::uint64_t nans[] = {0x7FF8000000000000ull, 0xFFF8000000000000ull,
                                       0x7FF0000000000001ull, 0xFFF4000000000123ull,
                                       0x7FFFFFFFFFFFFFFFull, 0x7FF8DEADBEEF0000ull};
  // Infinities and both zeros first; the last two only among NaNs.
  static const std::uint64_t others[] = {0x7FF0000000000000ull,
                                         0xFFF0000000000000ull,
                                         0x8000000000000000ull,
                                         0,
                                         Bits(1.0),
                                         Bits(-2.5)};
  std::mt19937_64 rng(seed);
  auto draw = [&]() {
    const bool nan = mix == kAllNan || (mix == kNanAndOthers && rng() % 2);
    return FromBits(nan ? nans[rng() % 6] : others[rng() % (mix == kNoNan ? 5 : 6)]);
  };
  Records r;
  r.nvars = 4;
  r.count = count;
  r.keys = kKeySets[keySet];
  r.values.resize(count * 4);
  for (std::size_t i = 0; i < count; ++i) {
    OBS* rec = &r.values[i * 4];
    rec[0] = draw();
    rec[1] = static_cast<double>(i);
    rec[2] = draw();
    const char* words[] = {"NaN     ", "Inf     ", "-0      ", "        "};
    std::memcpy(&rec[3], words[rng() % 4], 8);
  }
  if (mix == kNoNan) r.expected = testing_support::OracleSort(r.values, count, 4, r.keys);
  return r;
}

void ExpectEveryRecordOnce(const Records& r, const CallLog& log, Mix mix) {
  ASSERT_EQ(log.puts, r.count);
  EXPECT_TRUE(IsPermutationOfInput(r, log.output));
  if (mix == kNoNan) {
    EXPECT_TRUE(log.Prefix());
  }
}

class NanKeys : public FaultTest {};

TEST_F(NanKeys, EveryRecordOnceOnEveryPath) {
  const char* const pathNames[] = {"single batch", "one merge pass", "several merge passes"};
  for (unsigned workers : {1u, 3u}) {
    UseThreads(workers);
    for (int path = 0; path < 3; ++path) {
      for (Mix mix : {kAllNan, kNanAndOthers, kNoNan}) {
        for (int keySet = 0; keySet < 4; ++keySet) {
          SCOPED_TRACE(std::string(pathNames[path]) + ", " + kMixNames[mix] + ", key set " +
                       std::to_string(keySet) + ", " + std::to_string(workers) + " worker(s)");
          const Records r = NanRecords(4000, mix, keySet, 100 * keySet + mix);
          auto setup = [&](HookedSort& sort) {
            if (workers == 1) sort.SetNRows(1);
            if (path == 2) MakeItSpill(sort);
            if (path == 1) vexahost::SetStreamBufferSize(4096);
            // 8 MiB: still one batch, without the default target's 100 MiB
            // buffers; 256 KiB: a few runs merged in one pass.
            if (path != 2) sort.data().memoryTarget = path == 0 ? 8 << 20 : 256 << 10;
          };
          CallLog log(r);
          FileSort::Statistics stats;
          const Ending ending = SortWith(log, setup, nullptr, &stats);
          vexahost::SetStreamBufferSize(0);
          ASSERT_EQ(ending, Ending::Completed);
          ExpectEveryRecordOnce(r, log, mix);
          const std::size_t passes = stats.merges.size();
          EXPECT_TRUE(path == 0   ? passes == 0
                      : path == 1 ? passes == 1 && stats.runs.size() >= 2
                                  : passes >= 2)
              << passes << " merge passes";
        }
      }
    }
  }
}

TEST_F(NanKeys, ThroughSortFileInMemoryAndSpilled) {
  for (bool spill : {false, true}) {
    if (spill) {
      UseThreads(64);
      vexahost::SetStreamBufferSize(64 << 10);
    }
    for (Mix mix : {kAllNan, kNanAndOthers, kNoNan}) {
      for (int keySet : {1, 3}) {
        SCOPED_TRACE(std::string(spill ? "spilled, " : "in memory, ") + kMixNames[mix] +
                     ", key set " + std::to_string(keySet));
        const Records r = NanRecords(spill ? 40000 : 3000, mix, keySet, 7 + keySet);
        if (mix == kAllNan) {
          ASSERT_EQ(SortFileSpills(r), spill) << "not the path meant";
        }
        CallLog log(r);
        Ending ending;
        EXPECT_EQ(CallSortFile(log, SortFileKeys(r), &ending), 0);
        ExpectEveryRecordOnce(r, log, mix);
      }
    }
  }
}

}  // namespace
}  // namespace faults

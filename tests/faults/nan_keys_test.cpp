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

enum class Mix { AllNan, NanAndSpecials, NoNan };
const char* Name(Mix m) {
  return m == Mix::AllNan ? "all NaN" : m == Mix::NanAndSpecials ? "NaN among others" : "no NaN";
}

std::uint64_t Draw(std::mt19937_64& rng, Mix mix) {
  const std::uint64_t nans[] = {0x7FF8000000000000ull, 0xFFF8000000000000ull,
                                0x7FF0000000000001ull, 0xFFF4000000000123ull,
                                0x7FFFFFFFFFFFFFFFull, 0x7FF8DEADBEEF0000ull};
  const std::uint64_t others[] = {0x7FF0000000000000ull,
                                  0xFFF0000000000000ull,
                                  0x8000000000000000ull,
                                  0,
                                  Bits(1.0),
                                  Bits(-2.5)};
  switch (mix) {
    case Mix::AllNan:
      return nans[rng() % 6];
    case Mix::NanAndSpecials:
      return rng() % 2 ? nans[rng() % 6] : others[rng() % 6];
    case Mix::NoNan:
      return others[rng() % 5];  // infinities and both zeros (and 1.0)
  }
  return 0;
}

// Records of four values: two numeric keys' values, the input position, and
// a text value; the key set is chosen by `keySet`.
Records NanRecords(std::size_t count, Mix mix, int keySet, std::uint64_t seed) {
  std::mt19937_64 rng(seed);
  Records r;
  r.nvars = 4;
  r.count = count;
  switch (keySet) {
    case 0:
      r.keys = {{0, 1, 0}};
      break;
    case 1:
      r.keys = {{0, -1, 0}};
      break;
    case 2:
      r.keys = {{0, 1, 0}, {2, -1, 0}};
      break;
    default:
      r.keys = {{2, -1, 0}, {3, 1, 8}, {0, 1, 0}};
      break;
  }
  r.values.resize(count * 4);
  for (std::size_t i = 0; i < count; ++i) {
    OBS* rec = &r.values[i * 4];
    rec[0] = FromBits(Draw(rng, mix));
    rec[1] = static_cast<double>(i);
    rec[2] = FromBits(Draw(rng, mix));
    const char* words[] = {"NaN     ", "Inf     ", "-0      ", "        "};
    std::memcpy(&rec[3], words[rng() % 4], 8);
  }
  if (mix == Mix::NoNan) r.expected = testing_support::OracleSort(r.values, count, 4, r.keys);
  return r;
}

enum class Path { SingleBatch, OnePass, SeveralPasses };
const char* Name(Path p) {
  return p == Path::SingleBatch ? "single batch"
         : p == Path::OnePass   ? "one merge pass"
                                : "several merge passes";
}

class NanKeys : public FaultTest {};

TEST_F(NanKeys, EveryRecordOnceOnEveryPath) {
  int sorts = 0;
  for (unsigned workers : {1u, 3u}) {
    UseThreads(workers);
    for (Path path : {Path::SingleBatch, Path::OnePass, Path::SeveralPasses}) {
      for (Mix mix : {Mix::AllNan, Mix::NanAndSpecials, Mix::NoNan}) {
        for (int keySet = 0; keySet < 4; ++keySet) {
          SCOPED_TRACE(std::string(Name(path)) + ", " + Name(mix) + ", key set " +
                       std::to_string(keySet) + ", " + std::to_string(workers) + " worker(s)");
          const Records r = NanRecords(4000, mix, keySet, 100 * keySet + static_cast<int>(mix));
          CallLog log(r);
          FileSort::Statistics stats;
          {
            HookedSort sort(r, log, &stats);
            if (workers == 1) sort.SetNRows(1);
            if (path == Path::SingleBatch) {
              sort.data().memoryTarget = 8 << 20;  // still one batch, without 100 MiB buffers
            } else if (path == Path::OnePass) {
              sort.data().memoryTarget = 256 << 10;
              vexahost::SetStreamBufferSize(4096);
            } else if (path == Path::SeveralPasses) {
              MakeItSpill(sort);
            }
            ASSERT_EQ(RunSort(sort), Ending::Completed);
          }
          vexahost::SetStreamBufferSize(0);
          ++sorts;
          ASSERT_EQ(log.puts, r.count);
          EXPECT_TRUE(IsPermutationOfInput(r, log.output));
          if (mix == Mix::NoNan) {
            EXPECT_TRUE(log.DeliveredPrefixOf(r.expected, r.nvars));
          }
          switch (path) {
            case Path::SingleBatch:
              EXPECT_TRUE(stats.merges.empty());
              break;
            case Path::OnePass:
              EXPECT_GE(stats.runs.size(), 2u);
              EXPECT_EQ(stats.merges.size(), 1u);
              break;
            case Path::SeveralPasses:
              EXPECT_GE(stats.merges.size(), 2u);
              break;
          }
        }
      }
    }
  }
  std::printf("%d sorts of NaN-laden keys\n", sorts);
}

TEST_F(NanKeys, ThroughSortFileInMemoryAndSpilled) {
  for (bool spill : {false, true}) {
    if (spill) {
      UseThreads(64);
      vexahost::SetStreamBufferSize(64 << 10);
    }
    for (Mix mix : {Mix::AllNan, Mix::NanAndSpecials, Mix::NoNan}) {
      for (int keySet : {1, 3}) {
        SCOPED_TRACE(std::string(spill ? "spilled, " : "in memory, ") + Name(mix) + ", key set " +
                     std::to_string(keySet));
        const Records r = NanRecords(spill ? 40000 : 3000, mix, keySet, 7 + keySet);
        if (mix == Mix::AllNan) {
          ASSERT_EQ(SortFileSpills(r), spill) << "not the path meant";
        }
        CallLog log(r);
        Ending ending;
        EXPECT_EQ(CallSortFile(r, SortFileKeys(r), log, &ending), 0);
        ASSERT_EQ(log.puts, r.count);
        EXPECT_TRUE(IsPermutationOfInput(r, log.output));
        if (mix == Mix::NoNan) {
          EXPECT_TRUE(log.DeliveredPrefixOf(r.expected, r.nvars));
        }
      }
    }
  }
}

}  // namespace
}  // namespace faults

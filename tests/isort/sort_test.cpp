// FileSort from end to end against an oracle: every size, key set and path
// (single batch, several runs, several merge passes), statistics, failures.
#include <gtest/gtest.h>

#include <random>
#include <thread>

#include "sort_harness.h"

using namespace testing_support;

namespace {

struct Foreign {};

// A random table and key set: keys in any variable order, both directions,
// numeric and string keys of widths 1, 8, 9, 16, 17, repeats and overlaps;
// key values drawn from small sets for many ties; other values awkward.
struct Table {
  unsigned nvars;
  std::vector<Key> keys;
  std::vector<OBS> values;
  std::size_t records;
};

Table RandomTable(std::mt19937_64& rng, std::size_t records) {
  Table t;
  t.records = records;
  t.nvars = 1 + rng() % 12;
  const unsigned widths[] = {0, 0, 0, 1, 8, 9, 16, 17};
  const int nkeys = rng() % 5;
  for (int k = 0; k < nkeys; ++k) {
    const unsigned width = widths[rng() % 8];
    const unsigned step = KeyStep(width);
    if (step > t.nvars) continue;
    const int variable = static_cast<int>(rng() % (t.nvars - step + 1));
    t.keys.push_back({variable, rng() % 2 ? 1 : -1, width});
  }
  t.values.resize(records * t.nvars);
  for (OBS& v : t.values) v = AwkwardValue(rng);
  // Key values: numbers from a small set (with -0.0 and infinities), text
  // from a small alphabet so that keys tie and share prefixes.
  const std::uint64_t numbers[] = {Bits(-1.5), Bits(0.0), 0x8000000000000000ull, Bits(2.0),
                                   Bits(1e300), 0xFFF0000000000000ull, Bits(7.0)};
  for (std::size_t r = 0; r < records; ++r) {
    OBS* rec = &t.values[r * t.nvars];
    for (const Key& k : t.keys) {
      if (k.width == 0) {
        rec[k.variable] = FromBits(numbers[rng() % 7]);
      } else {
        unsigned char* bytes = reinterpret_cast<unsigned char*>(rec + k.variable);
        const char alphabet[] = "AB a\0\xff";
        for (unsigned i = 0; i < KeyStep(k.width) * 8; ++i) bytes[i] = alphabet[rng() % 6];
      }
    }
    // Text written over a numeric key's value may spell a NaN, which has no order.
    for (const Key& k : t.keys) {
      double x;
      std::memcpy(&x, &rec[k.variable], 8);
      if (k.width == 0 && x != x) rec[k.variable] = 3.0;
    }
  }
  return t;
}

std::string Describe(const Table& t) {
  std::string s = "nvars " + std::to_string(t.nvars) + " records " + std::to_string(t.records) +
                  " keys";
  for (const Key& k : t.keys) {
    s += " {" + std::to_string(k.variable) + "," + std::to_string(k.direction) + "," +
         std::to_string(k.width) + "}";
  }
  return s;
}

class Sorting : public SortTest {};

}  // namespace

// Small memory targets (below the public floor, through the internal
// field) and small stream buffers reach several runs and merge passes
// with kilobytes of records.
TEST_F(Sorting, OracleOnRandomKeySetsAndPaths) {
  const unsigned seed = ::testing::UnitTest::GetInstance()->random_seed();
  std::mt19937_64 rng(seed);
  SCOPED_TRACE("seed " + std::to_string(seed));
  const std::size_t sizes[] = {0, 1, 2, 3, 4, 5, 6, 7, 40, 41, 1000, 3000};
  const std::uint32_t targets[] = {0, 64 << 10, 8 << 10, 1 << 10};
  const unsigned buffers[] = {0, 4096, 512};
  for (int trial = 0; trial < 120; ++trial) {
    const std::size_t n = sizes[trial % 12];
    Table t = RandomTable(rng, n);
    const std::uint32_t target = targets[rng() % 4];
    const unsigned buffer = buffers[rng() % 3];
    const unsigned threads = 1 + rng() % 3;
    UseThreads(threads);
    vexahost::SetStreamBufferSize(buffer);
    SCOPED_TRACE(Describe(t) + " target " + std::to_string(target) + " buffer " +
                 std::to_string(buffer) + " threads " + std::to_string(threads));
    FileSort::Statistics stats;
    VectorSort sort(t.keys, t.nvars, &t.values, n, &stats);
    if (target) sort.ForceMemoryTarget(target);
    sort.Sort();
    ASSERT_TRUE(SameBits(sort.output, OracleSort(t.values, n, t.nvars, t.keys)));
    ASSERT_EQ(sort.delivered, n);
    EXPECT_TRUE(sort.sameBuffer);
    EXPECT_EQ(stats.records, n);
  }
}

TEST_F(Sorting, StatisticsOfASpilledSort) {
  std::mt19937_64 rng(23);
  const std::size_t n = 5000;
  std::vector<OBS> values(n * 5);
  for (OBS& v : values) v = static_cast<double>(rng() % 100000);
  std::vector<Key> keys{{3, 1, 0}};
  vexahost::SetStreamBufferSize(1024);
  FileSort::Statistics stats;
  stats.records = 7;  // the sort adds, it never resets
  VectorSort sort(keys, 5, &values, n, &stats);
  sort.ForceMemoryTarget(16 << 10);
  sort.Sort();
  ASSERT_TRUE(SameBits(sort.output, OracleSort(values, n, 5, keys)));
  EXPECT_EQ(stats.records, n + 7);
  EXPECT_EQ(stats.recordBytes, 40u);
  EXPECT_EQ(stats.threads, 2u);
  std::uint64_t batched = 0;
  for (const auto& run : stats.runs) {
    EXPECT_GT(run.records, 0u);
    EXPECT_LE(run.records, run.capacity);
    batched += run.records;
  }
  EXPECT_EQ(batched, n);
  ASSERT_GE(stats.merges.size(), 2u) << "expected several passes";
  for (std::size_t i = 0; i + 1 < stats.merges.size(); ++i) EXPECT_GT(stats.merges[i].bytes, 0u);
  EXPECT_EQ(stats.merges.back().bytes, 0u);
  EXPECT_GT(stats.workFileBytes, 0u);
  // Every run is merged exactly once: passes take runs and add one each.
  std::uint64_t taken = 0;
  for (const auto& m : stats.merges) taken += m.runs;
  EXPECT_EQ(taken, stats.runs.size() + stats.merges.size() - 1);

  // Without statistics the sort runs the same.
  VectorSort quiet(keys, 5, &values, n, nullptr);
  quiet.ForceMemoryTarget(16 << 10);
  quiet.Sort();
  EXPECT_TRUE(SameBits(quiet.output, sort.output));
}

TEST_F(Sorting, EmptyInputAndSecondSort) {
  std::vector<OBS> none;
  FileSort::Statistics stats;
  VectorSort empty({{0, 1, 0}}, 3, &none, 0, &stats);
  empty.Sort();
  EXPECT_EQ(empty.delivered, 0u);
  EXPECT_EQ(stats.records, 0u);
  EXPECT_TRUE(stats.runs.empty());
  EXPECT_TRUE(stats.merges.empty());
  EXPECT_EQ(stats.recordBytes, 24u);
  EXPECT_EQ(stats.threads, 2u);

  std::vector<OBS> values{3, 1, 2};
  VectorSort once({{0, 1, 0}}, 1, &values, 3);
  once.Sort();
  const std::size_t calls = once.getCalls;
  once.Sort();
  EXPECT_EQ(once.getCalls, calls);
  EXPECT_EQ(once.output, (std::vector<OBS>{1, 2, 3}));
}

// NaN keys give no consistent order, but every record still comes out once,
// bit for bit, on every path.
TEST_F(Sorting, NanKeysLoseNothing) {
  std::mt19937_64 rng(31);
  const std::size_t n = 4000;
  std::vector<OBS> values(n * 2);
  const std::uint64_t pool[] = {0x7FF8000000000000ull, 0x7FF0000000000001ull,
                                0x7FF0000000000000ull, 0xFFF0000000000000ull,
                                0x8000000000000000ull, 0, Bits(1.0)};
  for (std::size_t i = 0; i < n; ++i) {
    values[2 * i] = FromBits(pool[rng() % 7]);
    values[2 * i + 1] = static_cast<double>(i);
  }
  for (std::uint32_t target : {0u, 8u << 10}) {
    VectorSort sort({{0, 1, 0}}, 2, &values, n);
    if (target) sort.ForceMemoryTarget(target);
    sort.Sort();
    ASSERT_EQ(sort.delivered, n);
    std::vector<int> seen(n, 0);
    for (std::size_t i = 0; i < n; ++i) {
      const auto id = static_cast<std::size_t>(sort.output[2 * i + 1]);
      ASSERT_LT(id, n);
      ++seen[id];
      EXPECT_EQ(Bits(sort.output[2 * i]), Bits(values[2 * id]));
    }
    EXPECT_EQ(std::count(seen.begin(), seen.end(), 1), static_cast<long>(n));
  }
}

namespace {

enum class Kind { BadAlloc, Error, Foreign };

[[noreturn]] void Throw(Kind kind) {
  switch (kind) {
    case Kind::BadAlloc: throw std::bad_alloc();
    case Kind::Error: throw ErrorText("callback failed", 3);
    case Kind::Foreign: throw Foreign();
  }
  throw 0;
}

// Runs sort.Sort() and says which kind left it ("none" when nothing did).
std::string Outcome(VectorSort& sort) {
  try {
    sort.Sort();
    return "none";
  } catch (const std::bad_alloc&) {
    return "bad_alloc";
  } catch (const ErrorText& e) {
    EXPECT_EQ(e.Text(), "callback failed");
    EXPECT_EQ(e.Attribute(), 3);
    return "ErrorText";
  } catch (const Foreign&) {
    return "Foreign";
  }
}

const char* Name(Kind kind) {
  return kind == Kind::BadAlloc ? "bad_alloc" : kind == Kind::Error ? "ErrorText" : "Foreign";
}

}  // namespace

// Callbacks that throw at record k, in the single-batch path and in the
// merge: the exception leaves Sort() as it was thrown, what was delivered
// stays delivered, and a second Sort() fails the same way.
TEST_F(Sorting, CallbackFailures) {
  std::mt19937_64 rng(41);
  const std::size_t n = 2000;
  std::vector<OBS> values(n * 3);
  for (OBS& v : values) v = static_cast<double>(rng() % 300);
  std::vector<Key> keys{{0, 1, 0}};
  const std::vector<OBS> expect = OracleSort(values, n, 3, keys);
  for (bool spill : {false, true}) {
    for (bool inPut : {false, true}) {
      for (Kind kind : {Kind::BadAlloc, Kind::Error, Kind::Foreign}) {
        for (std::size_t k : {std::size_t{0}, std::size_t{2}, n / 2, n - 1}) {
          SCOPED_TRACE(std::string(spill ? "merge" : "single batch") + (inPut ? " put " : " get ") +
                       Name(kind) + " at " + std::to_string(k));
          VectorSort sort(keys, 3, &values, n);
          if (spill) sort.ForceMemoryTarget(8 << 10);
          bool thrown = false;
          auto hook = [&](std::size_t i) {
            EXPECT_FALSE(thrown) << "a callback ran after the failure";
            if (i == k) {
              thrown = true;
              Throw(kind);
            }
          };
          (inPut ? sort.onPut : sort.onGet) = hook;
          EXPECT_EQ(Outcome(sort), Name(kind));
          if (inPut) {
            ASSERT_EQ(sort.delivered, k);
            EXPECT_TRUE(std::equal(sort.output.begin(), sort.output.end(), expect.begin()));
          } else {
            EXPECT_EQ(sort.delivered, 0u);
          }
          // The same failure again, and no callback runs.
          const std::size_t gets = sort.getCalls, puts = sort.delivered;
          EXPECT_EQ(Outcome(sort), Name(kind));
          EXPECT_EQ(sort.getCalls, gets);
          EXPECT_EQ(sort.delivered, puts);
        }
      }
    }
  }
}

TEST_F(Sorting, OutOfMemoryWinsOverAnError) {
  std::vector<OBS> values{1, 2, 3};
  VectorSort sort({{0, 1, 0}}, 1, &values, 3);
  sort.data().RecordError(ErrorText("disk trouble"));
  sort.data().RecordOutOfMemory();
  EXPECT_EQ(Outcome(sort), "bad_alloc");
  EXPECT_EQ(sort.getCalls, 0u);
}

// Workers may record failures at the same moment (run under TSan).
TEST_F(Sorting, ConcurrentFailuresAreRecordedSafely) {
  std::vector<OBS> values{1};
  VectorSort sort({}, 1, &values, 1);
  std::vector<std::thread> workers;
  for (int i = 0; i < 4; ++i) {
    workers.emplace_back([&sort, i] {
      for (int j = 0; j < 200; ++j) sort.data().RecordError(ErrorText("worker " + std::to_string(i)));
    });
  }
  for (auto& w : workers) w.join();
  try {
    sort.Sort();
    ADD_FAILURE() << "no failure";
  } catch (const ErrorText& e) {
    EXPECT_EQ(e.Text().rfind("worker ", 0), 0u) << e.Text();
  }
}

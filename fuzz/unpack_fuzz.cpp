// SrtUnpack on arbitrary packed records, and SRTFPK/SrtUnpack round trips.
//
// Input: a byte of settings, the case width, the map's size and its pairs,
// the string keys, the header's length word, then the record's bytes. Maps
// and key descriptors are made to fit their buffers, as a caller's must;
// the packed record is exactly as long as its length word says (or as its
// uncompressed key runs need), and its contents are arbitrary. Unpacking
// must stay inside the record and the case (the sanitizers watch), write
// nothing outside the mapped variables, and, for a record that SRTFPK made,
// give back the case.
#include <cstdint>
#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <vector>

#include "isort/host/iostore.h"
#include "isort/sortfile.h"

#include "fuzz_input.h"

namespace {

[[noreturn]] void Fail(const char* what) { fuzzing::Fail("packed records", what); }

// A buffer of exactly `bytes`, so that a read or write past it is caught.
struct Exact {
  explicit Exact(std::size_t bytes)
      : p(static_cast<unsigned char*>(std::malloc(bytes ? bytes : 1))) {}
  ~Exact() { std::free(p); }
  Exact(const Exact&) = delete;
  Exact& operator=(const Exact&) = delete;
  unsigned char* p;
};

constexpr std::uint64_t kUntouched = 0x5A5A5A5A5A5A5A5Aull;

}  // namespace

extern "C" int LLVMFuzzerTestOneInput(const std::uint8_t* data, std::size_t size) {
  fuzzing::Reader in(data, size);
  const std::uint8_t settings = in.Byte();
  const bool roundTrip = settings & 1;
  const int compress = (settings >> 1) & 1;
  const FortranInt ncase = 1 + in.Byte() % 48;
  const FortranInt nmap = in.Byte() % 12;
  const FortranInt nkeypairs = nmap ? in.Byte() % (nmap + 1) : 0;

  // Map pairs inside the case: first in 1..ncase, count up to what is left.
  std::vector<FortranInt> map(2 * static_cast<std::size_t>(nmap) + 2);
  std::vector<char> mapped(static_cast<std::size_t>(ncase), 0);
  std::size_t plainValues = 0, allValues = 0;
  for (FortranInt i = 0; i < nmap; ++i) {
    const FortranInt first = 1 + in.Byte() % ncase;
    const FortranInt count = in.Byte() % (ncase - first + 2);
    map[2 * i] = first;
    map[2 * i + 1] = count;
    for (FortranInt v = 0; v < count; ++v) mapped[first - 1 + v] = 1;
    allValues += static_cast<std::size_t>(count);
    if (i < nkeypairs) plainValues += static_cast<std::size_t>(count);
  }
  const std::size_t plain = compress ? plainValues : allValues;

  if (roundTrip) {
    // A case, packed by SRTFPK into a record of exactly its size, then
    // unpacked: every mapped variable comes back bit for bit.
    std::vector<OBS> original(static_cast<std::size_t>(ncase));
    in.Fill(reinterpret_cast<unsigned char*>(original.data()), original.size() * sizeof(OBS));
    const std::size_t bound =
        8 + 8 * plain + (compress ? VEXA_CompressedBound(allValues - plain) : 0);
    Exact packed(bound);
    const FortranInt header1 = static_cast<FortranInt>(in.Word());
    const FortranInt noKeys[3] = {1, -1, 1};
    SRTFPK(original.data(), reinterpret_cast<FortranInt*>(packed.p), &header1, map.data(), noKeys,
           &nmap, &nkeypairs, &compress);
    FortranInt words[2];
    std::memcpy(words, packed.p, sizeof words);
    if (words[0] < 2 || static_cast<std::size_t>(words[0]) * 4 > bound || words[1] != header1)
      Fail("header of a packed record");
    std::vector<OBS> back(static_cast<std::size_t>(ncase));
    for (OBS& v : back) std::memcpy(&v, &kUntouched, sizeof v);
    SrtUnpack(reinterpret_cast<OBS*>(packed.p + 8), back.data(), map.data(), noKeys, nmap,
              nkeypairs, compress);
    for (FortranInt v = 0; v < ncase; ++v) {
      const void* expect = mapped[v] ? static_cast<const void*>(&original[v]) : &kUntouched;
      if (std::memcmp(&back[v], expect, sizeof(OBS)) != 0) Fail("round trip");
    }
    return 0;
  }

  // An arbitrary record: its length word, then bytes.
  const FortranInt lengthWord = static_cast<FortranInt>(in.Word() % 4096);
  std::size_t bytes = lengthWord > 0 ? static_cast<std::size_t>(lengthWord) * 4 : 0;
  if (bytes < 8 + 8 * plain) bytes = 8 + 8 * plain;  // the key runs are read whole
  Exact packed(bytes);
  std::memcpy(packed.p, &lengthWord, sizeof lengthWord);
  in.Fill(packed.p + 4, bytes - 4);

  // String keys (offset in values with the header as 0, width, direction),
  // each inside the record, closed by a negative width.
  const int nkeys = in.Byte() % 4;
  std::vector<FortranInt> keys;
  const std::size_t values = (bytes - 8) / 8;
  for (int k = 0; k < nkeys && values > 0; ++k) {
    const FortranInt offset = 1 + in.Byte() % static_cast<FortranInt>(values);
    const std::size_t room = bytes - static_cast<std::size_t>(offset) * 8;
    const FortranInt width = static_cast<FortranInt>(in.Byte() % (room < 40 ? room + 1 : 41));
    keys.insert(keys.end(), {offset, width, 1});
  }
  keys.insert(keys.end(), {1, -1, 1});

  std::vector<OBS> unpacked(static_cast<std::size_t>(ncase));
  for (OBS& v : unpacked) std::memcpy(&v, &kUntouched, sizeof v);
  SrtUnpack(reinterpret_cast<OBS*>(packed.p + 8), unpacked.data(), map.data(), keys.data(), nmap,
            nkeypairs, compress);
  for (FortranInt v = 0; v < ncase; ++v) {
    if (!mapped[v] && std::memcmp(&unpacked[v], &kUntouched, sizeof(OBS)) != 0)
      Fail("a variable outside the map was written");
  }
  return 0;
}

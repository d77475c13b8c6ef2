// SRTFVA on arbitrary key arrays.
//
// Input: the key count, the case width, the pack flag, then a variable, a
// direction and a width per key, drawn around the valid ranges. SRTFVA is
// called first for the counts only, then with arrays of exactly that size.
// It must reject exactly the invalid keys (code 10, counts 0); otherwise its
// map must cover every variable of the case once, each key's descriptor
// must point at its values in the packed record, no internal check may
// fire, and a case packed and unpacked through the map must come back.
#include <cstdint>
#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <string>
#include <vector>

#include "host/hostsettings.h"
#include "isort/host/iostore.h"
#include "isort/sortfile.h"

#include "fuzz_input.h"

namespace {

[[noreturn]] void Fail(const char* what) { fuzzing::Fail("SRTFVA", what); }

// Values a key spans, as SRTFVA counts them.
std::int64_t Span(FortranInt width) { return (std::int64_t{width} - 1) / 8 + 1; }

void AbortOnReport() {
  static bool set = false;
  if (set) return;
  set = true;
  vexahost::SetReportSink([](const std::string& message) {
    std::fprintf(stderr, "report: %s\n", message.c_str());
    std::abort();
  });
}

}  // namespace

extern "C" int LLVMFuzzerTestOneInput(const std::uint8_t* data, std::size_t size) {
  AbortOnReport();
  fuzzing::Reader in(data, size);
  const FortranInt n = static_cast<FortranInt>(in.Byte() % 14) - 1;  // -1 to 12
  // A case of at least one value (with none, the trailing gap that the
  // count formula promises cannot be written).
  const FortranInt widraw = 1 + in.Byte() % 40;
  const FortranInt pack = in.Byte() & 3;
  const std::size_t keys = n > 0 ? static_cast<std::size_t>(n) : 0;

  std::vector<FortranInt> ukeys(3 * keys + 1);
  bool valid = n >= 0;
  for (std::size_t i = 0; i < keys; ++i) {
    const FortranInt variable = static_cast<FortranInt>(in.Byte() % (widraw + 4)) - 1;
    const std::uint8_t d = in.Byte();
    const FortranInt direction = d < 200 ? (d & 1 ? 1 : -1) : static_cast<FortranInt>(d % 5) - 2;
    const std::uint8_t w = in.Byte();
    const FortranInt width = w < 250 ? static_cast<FortranInt>(w % 48) - 1 : 0x7FFFFFF0 + w % 6;
    ukeys[i] = variable;
    ukeys[keys + i] = direction;
    ukeys[2 * keys + i] = width;
    valid = valid && variable >= 1 && width >= 0 && (direction == 1 || direction == -1) &&
            variable + Span(width) <= widraw + 1;
  }

  const FortranInt countsOnly = 0, fill = 1;
  FortranInt nmap = -7, nkeypairs = -7, keylength = -7;
  const FortranInt code = SRTFVA(&n, ukeys.data(), nullptr, nullptr, &nmap, &nkeypairs, &keylength,
                                 &widraw, &pack, &countsOnly);
  if (code != (valid ? 0 : 10)) Fail("validity");
  if (!valid) {
    if (nmap != 0 || nkeypairs != 0 || keylength != 0) Fail("counts of invalid keys");
    return 0;
  }
  const bool packing = pack & 1;
  if (!packing) {
    if (nmap != 0 || nkeypairs != 0 || keylength != 0) Fail("counts without packing");
  } else if (nmap < 0 || nkeypairs < 0 || nkeypairs > n || keylength < 0) {
    Fail("counts");
  }

  std::vector<FortranInt> keysOut(3 * keys + 3, -9);
  std::vector<FortranInt> mapOut(2 * static_cast<std::size_t>(nmap), -9);
  FortranInt nmap2, nkeypairs2, keylength2;
  if (SRTFVA(&n, ukeys.data(), keysOut.data(), mapOut.data(), &nmap2, &nkeypairs2, &keylength2,
             &widraw, &pack, &fill) != 0 ||
      nmap2 != nmap || nkeypairs2 != nkeypairs || keylength2 != keylength)
    Fail("counts differ between the two calls");
  if (keysOut[3 * keys + 1] >= 0) Fail("key list not closed");

  if (!packing) {
    for (std::size_t i = 0; i < keys; ++i) {
      if (keysOut[3 * i] != ukeys[i] || keysOut[3 * i + 1] != ukeys[2 * keys + i] ||
          keysOut[3 * i + 2] != ukeys[keys + i])
        Fail("key triples without packing");
    }
    return 0;
  }

  // Where each variable lands in the packed record (the header is 0).
  std::vector<std::int64_t> position(static_cast<std::size_t>(widraw) + 1, -1);
  std::int64_t next = 1, keyValues = 0;
  for (FortranInt i = 0; i < nmap; ++i) {
    const FortranInt first = mapOut[2 * i], count = mapOut[2 * i + 1];
    if (first < 1 || count < 1 || first + count - 1 > widraw) Fail("map pair outside the case");
    for (FortranInt v = first; v < first + count; ++v) {
      if (position[v] != -1) Fail("variable mapped twice");
      position[v] = next++;
    }
    if (i < nkeypairs) keyValues += count;
  }
  for (FortranInt v = 1; v <= widraw; ++v) {
    if (position[v] == -1) Fail("variable not mapped");
  }
  if (keyValues != keylength) Fail("key length");
  for (std::size_t i = 0; i < keys; ++i) {
    const FortranInt variable = ukeys[i];
    const FortranInt width = ukeys[2 * keys + i];
    if (keysOut[3 * i] != position[variable] || keysOut[3 * i + 1] != width ||
        keysOut[3 * i + 2] != ukeys[keys + i])
      Fail("key descriptor");
    for (std::int64_t v = 1; v < Span(width); ++v) {
      if (position[variable + v] != position[variable] + v) Fail("key split in the packed record");
    }
    if (position[variable] + Span(width) - 1 > keylength) Fail("key outside the key runs");
  }

  // A case of letters (no blanks, no zero bytes, so the string keys are not
  // trimmed) packed and unpacked, with and without compression.
  std::vector<OBS> original(static_cast<std::size_t>(widraw));
  unsigned char* bytes = reinterpret_cast<unsigned char*>(original.data());
  for (std::size_t i = 0; i < original.size() * 8; ++i) bytes[i] = 'A' + (i * 7 + in.Byte()) % 26;
  for (FortranInt compress : {0, 1}) {
    std::vector<FortranInt> packed(2 + 2 * static_cast<std::size_t>(widraw) +
                                   2 * ((static_cast<std::size_t>(widraw) + 7) / 8));
    const FortranInt header1 = 5;
    SRTFPK(original.data(), packed.data(), &header1, mapOut.data(), keysOut.data(), &nmap,
           &nkeypairs, &compress);
    for (std::size_t i = 0; i < keys; ++i) {
      const std::size_t width = static_cast<std::size_t>(ukeys[2 * keys + i]);
      const unsigned char* field = reinterpret_cast<const unsigned char*>(packed.data()) +
                                   8 * static_cast<std::size_t>(keysOut[3 * i]);
      const unsigned char* value = bytes + 8 * static_cast<std::size_t>(ukeys[i] - 1);
      if (std::memcmp(field, value, width == 0 ? 8 : width) != 0) Fail("key values when packed");
    }
    std::vector<OBS> back(original.size());
    SRTFUP(packed.data(), back.data(), mapOut.data(), keysOut.data(), &nmap, &nkeypairs, &compress);
    if (!original.empty() &&
        std::memcmp(back.data(), original.data(), original.size() * sizeof(OBS)) != 0)
      Fail("pack and unpack");
  }
  return 0;
}

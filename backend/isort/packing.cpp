// Packed case records: SRTFPK, SRTFUP and SrtUnpack.
//
// The compressed part uses the host's codec (iostore.h), the one definition
// of the compressed case encoding; nothing here knows its codes.
#include <cstddef>
#include <cstdint>
#include <cstring>

#include "commonblocks.h"
#include "isort/host/iostore.h"
#include "isort/host/vexawlib.h"
#include "sortfile.h"

namespace {

constexpr std::size_t kHeaderBytes = 8;
constexpr unsigned char kBlank = 0x20;

// Runs from 1000 values on go through the host's block move. The packed
// side may be aligned to 4 bytes only (a Fortran INTEGER array).
void CopyRun(const void* from, void* to, FortranInt count) {
  if (count <= 0) return;
  if (count < 1000) {
    std::memcpy(to, from, static_cast<std::size_t>(count) * sizeof(OBS));
  } else {
    OBMOVE(static_cast<const OBS*>(from), static_cast<OBS*>(to), &count);
  }
}

// The values of `count` positive, else nothing: a map never holds negative
// counts, and one that did must not turn into a huge copy.
std::size_t RunLength(FortranInt count) { return count > 0 ? static_cast<std::size_t>(count) : 0; }

// Key descriptor triples are (offset, width, direction); the first with a
// negative width closes the list. Calls f(field, width) for each string key.
template <typename F>
void ForEachStringKey(unsigned char* record, const FortranInt* keys, F f) {
  for (const FortranInt* k = keys; k[1] >= 0; k += 3) {
    if (k[1] > 0) f(record + static_cast<std::ptrdiff_t>(k[0]) * 8, static_cast<std::size_t>(k[1]));
  }
}

// Ends a blank-padded field's text with a 0 byte; a field whose last byte is
// not a blank is left as it is.
void TrimStringKey(unsigned char* field, std::size_t width) {
  if (field[width - 1] != kBlank) return;
  std::size_t end = width;  // one past the last non-blank byte
  while (end > 0 && field[end - 1] == kBlank) --end;
  field[end] = 0;
}

// The inverse: the 0 byte and everything after it become blanks again.
void RestoreStringKey(unsigned char* field, std::size_t width) {
  void* zero = std::memchr(field, 0, width);
  if (zero) {
    unsigned char* from = static_cast<unsigned char*>(zero);
    std::memset(from, kBlank, static_cast<std::size_t>(field + width - from));
  }
}

// Copies the system-missing value; read once per call. A copy by bytes,
// not a double result, which on i686 would travel through an x87 register.
void ReadSystemMissing(OBS* missing) {
  std::memcpy(missing, SystemMissingPattern(), sizeof *missing);
}

}  // namespace

void VEXA_STDCALL SRTFPK(const OBS* caseValues, FortranInt* packed, const FortranInt* header1,
                         const FortranInt* map, const FortranInt* keys, const FortranInt* nmap,
                         const FortranInt* nkeypairs, const FortranInt* compress) {
  unsigned char* const record = reinterpret_cast<unsigned char*>(packed);
  const bool compressing = *compress != 0;
  const FortranInt pairs = *nmap;
  const FortranInt plain = compressing ? *nkeypairs : pairs;

  unsigned char* out = record + kHeaderBytes;
  FortranInt i = 0;
  for (; i < plain && i < pairs; ++i) {
    const FortranInt count = map[2 * i + 1];
    CopyRun(caseValues + (map[2 * i] - 1), out, count);
    out += RunLength(count) * sizeof(OBS);
  }
  if (compressing) {
    OBS missing;
    ReadSystemMissing(&missing);
    VEXA_CaseEncoder encoder;
    VEXA_EncodeStart(encoder, out);
    for (; i < pairs; ++i) {
      VEXA_EncodeValues(encoder, caseValues + (map[2 * i] - 1), RunLength(map[2 * i + 1]),
                        &missing);
    }
    out = VEXA_EncodeFinish(encoder);
  }

  // Length in 4-byte words, header included.
  const FortranInt words[2] = {static_cast<FortranInt>((out - record) / 4), *header1};
  std::memcpy(record, words, sizeof words);

  ForEachStringKey(record, keys, TrimStringKey);
}

void SrtUnpack(OBS* data, OBS* caseValues, const FortranInt* map, const FortranInt* keys,
               FortranInt nmap, FortranInt nkeypairs, int compress) {
  unsigned char* const record = reinterpret_cast<unsigned char*>(data) - kHeaderBytes;
  ForEachStringKey(record, keys, RestoreStringKey);

  const FortranInt plain = compress ? nkeypairs : nmap;
  const unsigned char* in = record + kHeaderBytes;
  FortranInt i = 0;
  std::size_t plainValues = 0;
  for (; i < plain && i < nmap; ++i) {
    const FortranInt count = map[2 * i + 1];
    CopyRun(in, caseValues + (map[2 * i] - 1), count);
    in += RunLength(count) * sizeof(OBS);
    plainValues += RunLength(count);
  }
  if (!compress || i >= nmap) return;

  // The compressed part is decoded within the record's own length (header
  // word 0), never beyond what the encoding of the remaining values can
  // take: a damaged record yields system-missing values instead of reading
  // past its end.
  std::size_t remaining = 0;
  for (FortranInt j = i; j < nmap; ++j) remaining += RunLength(map[2 * j + 1]);
  FortranInt words;
  std::memcpy(&words, record, sizeof words);
  const std::uint64_t total = words > 0 ? static_cast<std::uint64_t>(words) * 4 : 0;
  const std::uint64_t used = kHeaderBytes + std::uint64_t{plainValues} * sizeof(OBS);
  std::uint64_t size = total > used ? total - used : 0;
  const std::uint64_t bound = VEXA_CompressedBound(remaining);
  if (size > bound) size = bound;

  OBS missing;
  ReadSystemMissing(&missing);
  VEXA_CaseDecoder decoder;
  VEXA_DecodeStart(decoder, in, static_cast<std::size_t>(size));
  for (; i < nmap; ++i) {
    VEXA_DecodeValues(decoder, caseValues + (map[2 * i] - 1), RunLength(map[2 * i + 1]), &missing);
  }
}

void VEXA_STDCALL SRTFUP(FortranInt* packed, OBS* caseValues, const FortranInt* map,
                         const FortranInt* keys, const FortranInt* nmap,
                         const FortranInt* nkeypairs, const FortranInt* compress) {
  SrtUnpack(reinterpret_cast<OBS*>(packed + 2), caseValues, map, keys, *nmap, *nkeypairs,
            *compress != 0);
}

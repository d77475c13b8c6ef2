// The compressed case encoding: the memory API and the stream functions.
//
// The stream functions work straight in the stream's window when it has
// room for a whole record (reading: VEXA_CompressedBound(n) bytes, as many
// as a record of n values can take), so a record costs no virtual call. With
// less room they go group by group: a group that fits the window is coded in
// place, otherwise it is moved through the stream's virtual Read or Write,
// which also refills or drains the object's buffer for the groups after it.
#include <algorithm>
#include <cstring>

#include "codec_core.h"
#include "hostinternal.h"
#include "isort/host/iostore.h"
#include "streamwindow.h"

using namespace vexahost::codec;
using W = VEXA_StreamWindow;

namespace {

// Values decoded from the rest of a damaged record.
void FillMissing(unsigned char* values, std::size_t n, std::uint64_t missing) {
  for (std::size_t i = 0; i < n; ++i) Store64(values + 8 * i, missing);
}

// Takes `bytes` from the window, then from Read; false when the data ends.
bool ReadExact(VEXA_StrBaseIO& from, unsigned char* to, std::size_t bytes) {
  const std::size_t inWindow = std::min(W::Readable(from), bytes);
  if (inWindow) {
    std::memcpy(to, W::Cursor(from), inWindow);
    W::Advance(from, W::Cursor(from) + inWindow);
  }
  const std::size_t rest = bytes - inWindow;
  return rest == 0 || from.Read(to + inWindow, static_cast<unsigned int>(rest)) == rest;
}

void WriteBytes(VEXA_StrBaseIO& to, const unsigned char* from, std::size_t bytes) {
  if (W::Writable(to) >= bytes) {
    std::memcpy(W::Cursor(to), from, bytes);
    W::Advance(to, W::Cursor(to) + bytes);
  } else {
    to.Write(from, static_cast<unsigned int>(bytes));
  }
}

// Reads one group of k codes that is not wholly in the window: its control
// block, then its literals. Leaves the group (control block first) in
// `group`. False when the data ends inside it.
bool ReadGroup(VEXA_StrBaseIO& from, unsigned k, unsigned char (&group)[72], bool& damaged) {
  if (!ReadExact(from, group, 8)) return false;
  const std::uint64_t control = Load64(group);
  damaged |= HasUndefined(control, k);
  return ReadExact(from, group + 8, 8 * CountLiterals(control, k));
}

}  // namespace

unsigned char VEXA_CaseCode(const OBS* value, const OBS* missing) {
  return ChooseCode(Load64(value), Load64(missing));
}

// ---- memory API

void VEXA_EncodeStart(VEXA_CaseEncoder& encoder, void* out) {
  encoder.next = static_cast<unsigned char*>(out);
  encoder.control = nullptr;
  encoder.codes = 0;
}

void VEXA_EncodeValues(VEXA_CaseEncoder& encoder, const OBS* values, std::size_t n,
                       const OBS* missing) {
  const std::uint64_t miss = Load64(missing);
  const unsigned char* from = reinterpret_cast<const unsigned char*>(values);
  // First fill up a group left open by the previous call.
  while (n && encoder.control && encoder.codes < kGroup) {
    const std::uint64_t v = Load64(from);
    const unsigned char c = ChooseCode(v, miss);
    encoder.control[encoder.codes++] = c;
    if (c == kLiteral) {
      Store64(encoder.next, v);
      encoder.next += 8;
    }
    from += 8;
    --n;
  }
  while (n) {
    const unsigned k = n < kGroup ? static_cast<unsigned>(n) : kGroup;
    encoder.control = encoder.next;
    encoder.next = EncodeGroup(encoder.next, from, k, miss);
    encoder.codes = k;
    from += 8 * k;
    n -= k;
  }
}

unsigned char* VEXA_EncodeFinish(VEXA_CaseEncoder& encoder) {
  // A group's unused control bytes were zeroed when it was opened.
  encoder.control = nullptr;
  encoder.codes = 0;
  return encoder.next;
}

void VEXA_DecodeStart(VEXA_CaseDecoder& decoder, const void* data, std::size_t size) {
  decoder.next = static_cast<const unsigned char*>(data);
  decoder.end = decoder.next + size;
  decoder.control = nullptr;
  decoder.codes = kGroup;
  decoder.damaged = false;
}

bool VEXA_DecodeValues(VEXA_CaseDecoder& decoder, OBS* values, std::size_t n,
                       const OBS* missing) {
  const std::uint64_t miss = Load64(missing);
  unsigned char* to = reinterpret_cast<unsigned char*>(values);
  while (n) {
    if (decoder.codes >= kGroup) {
      // A new group: whole in the data, decode it at once.
      const std::size_t available = static_cast<std::size_t>(decoder.end - decoder.next);
      if (available < 8) {
        FillMissing(to, n, miss);
        decoder.damaged = true;
        return false;
      }
      const unsigned k = n < kGroup ? static_cast<unsigned>(n) : kGroup;
      decoder.control = decoder.next;
      decoder.codes = 0;
      decoder.next += 8;
      if (available - 8 >= 8u * k) {
        decoder.next = DecodeGroup(decoder.control, k, to, miss, decoder.damaged);
        decoder.codes = k;
        to += 8 * k;
        n -= k;
        continue;
      }
    }
    // One value at a time near the end of the data, or inside a group that
    // an earlier call left open.
    const unsigned char c = decoder.control[decoder.codes++];
    std::uint64_t v = miss;
    switch (kTables.kind[c]) {
      case kTable:
        v = kTables.bits[c];
        break;
      case kLiteralKind:
        if (decoder.end - decoder.next >= 8) {
          v = Load64(decoder.next);
          decoder.next += 8;
        } else {
          decoder.next = decoder.end;
          decoder.damaged = true;
        }
        break;
      case kMissingKind:
        break;
      default:
        decoder.damaged = true;
        break;
    }
    Store64(to, v);
    to += 8;
    --n;
  }
  return !decoder.damaged;
}

// ---- stream functions

void WriteCompressed(VEXA_StrBaseIO& to, const OBS* values, long n) {
  if (n <= 0) return;
  const std::uint64_t miss = vexahost::internal::SystemMissingBits();
  const unsigned char* from = reinterpret_cast<const unsigned char*>(values);
  std::size_t count = static_cast<std::size_t>(n);
  if (W::Writable(to) >= VEXA_CompressedBound(count)) {
    W::Advance(to, EncodeRecord(W::Cursor(to), from, count, miss));
    return;
  }
  while (count) {
    const unsigned k = count < kGroup ? static_cast<unsigned>(count) : kGroup;
    if (W::Writable(to) >= 8 + 8 * k) {
      W::Advance(to, EncodeGroup(W::Cursor(to), from, k, miss));
    } else {
      unsigned char group[72];
      const unsigned char* end = EncodeGroup(group, from, k, miss);
      to.Write(group, static_cast<unsigned int>(end - group));
    }
    from += 8 * k;
    count -= k;
  }
}

bool ReadCompressed(VEXA_StrBaseIO& from, OBS* values, long n) {
  if (n <= 0) return true;
  const std::uint64_t miss = vexahost::internal::SystemMissingBits();
  unsigned char* to = reinterpret_cast<unsigned char*>(values);
  std::size_t count = static_cast<std::size_t>(n);
  const std::size_t inWindow = W::Readable(from);
  if (inWindow >= VEXA_CompressedBound(count)) {
    VEXA_CaseDecoder decoder;
    VEXA_DecodeStart(decoder, W::Cursor(from), inWindow);
    const bool ok = VEXA_DecodeValues(decoder, values, count, reinterpret_cast<const OBS*>(&miss));
    W::Advance(from, const_cast<unsigned char*>(decoder.next));
    return ok;
  }
  bool damaged = false;
  while (count) {
    const unsigned k = count < kGroup ? static_cast<unsigned>(count) : kGroup;
    if (W::Readable(from) >= 8 + 8 * k) {
      W::Advance(from, const_cast<unsigned char*>(
                           DecodeGroup(W::Cursor(from), k, to, miss, damaged)));
    } else {
      unsigned char group[72] = {};
      if (!ReadGroup(from, k, group, damaged)) {
        FillMissing(to, count, miss);
        return false;
      }
      DecodeGroup(group, k, to, miss, damaged);
    }
    to += 8 * k;
    count -= k;
  }
  return !damaged;
}

bool CopyPrecompressed(VEXA_StrBaseIO& from, VEXA_StrBaseIO& to, long n) {
  if (n <= 0) return true;
  std::size_t count = static_cast<std::size_t>(n);
  bool damaged = false;
  if (W::Readable(from) >= VEXA_CompressedBound(count)) {
    unsigned char* start = W::Cursor(from);
    const std::size_t length = RecordLength(start, count, damaged);
    WriteBytes(to, start, length);
    W::Advance(from, start + length);
    return !damaged;
  }
  while (count) {
    const unsigned k = count < kGroup ? static_cast<unsigned>(count) : kGroup;
    unsigned char group[72];
    if (!ReadGroup(from, k, group, damaged)) return false;
    WriteBytes(to, group, 8 + 8 * CountLiterals(Load64(group), k));
    count -= k;
  }
  return !damaged;
}

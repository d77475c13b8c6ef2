// Internal: the compressed case encoding's inner loops, shared by the memory
// API and the stream functions (codec.cpp) so the format is written once.
//
// Values are handled as 64-bit integers loaded with memcpy; a value never
// passes through a floating-point register, so every bit pattern, signaling
// NaNs included, comes back as it went in. Little-endian: control byte i of
// a block is bits 8i..8i+7 of its 64-bit load.
#pragma once

#include <cstddef>
#include <cstdint>
#include <cstring>

namespace vexahost {
namespace codec {

inline std::uint64_t Load64(const void* p) {
  std::uint64_t v;
  std::memcpy(&v, p, sizeof v);
  return v;
}
inline void Store64(void* p, std::uint64_t v) { std::memcpy(p, &v, sizeof v); }

constexpr unsigned kGroup = 8;                    // values per group
constexpr std::uint64_t kBlanks = 0x2020202020202020ull;
constexpr std::uint64_t kAllLiterals = 0xFDFDFDFDFDFDFDFDull;
constexpr unsigned char kLiteral = 253;
constexpr unsigned char kBlankCode = 254;
constexpr unsigned char kMissingCode = 255;
constexpr unsigned char kZeroCode = 100;

// High word of the double k, for an integer k with |k| < 2^20.
constexpr std::uint32_t IntegerHighWord(int k) {
  if (k == 0) return 0;
  const std::uint32_t sign = k < 0 ? 0x80000000u : 0u;
  const std::uint32_t magnitude = static_cast<std::uint32_t>(k < 0 ? -k : k);
  int exponent = 0;
  while ((magnitude >> (exponent + 1)) != 0) ++exponent;
  const std::uint32_t fraction = (magnitude << (20 - exponent)) & 0xFFFFFu;
  return sign | (static_cast<std::uint32_t>(exponent + 1023) << 20) | fraction;
}

// How a code decodes.
enum CodeKind : unsigned char { kTable = 0, kLiteralKind = 1, kMissingKind = 2, kUndefined = 3 };

struct Tables {
  std::uint32_t high[256];  // high word of code - 100 for codes 1..251
  std::uint64_t bits[256];  // the 8 bytes of codes 1..251 and 254
  unsigned char kind[256];
};

constexpr Tables MakeTables() {
  Tables t{};
  for (int c = 0; c < 256; ++c) {
    t.high[c] = 0;
    t.bits[c] = 0;
    t.kind[c] = kUndefined;
  }
  for (int c = 1; c <= 251; ++c) {
    t.high[c] = IntegerHighWord(c - 100);
    t.bits[c] = static_cast<std::uint64_t>(t.high[c]) << 32;
    t.kind[c] = kTable;
  }
  t.bits[kBlankCode] = kBlanks;
  t.kind[kBlankCode] = kTable;
  t.kind[kLiteral] = kLiteralKind;
  t.kind[kMissingCode] = kMissingKind;
  return t;
}

inline constexpr Tables kTables = MakeTables();

// Codes of the doubles with a zero low word, an exponent e from 0 to 7 and
// no fraction bits below the top seven, indexed by sign (bit 10), e (bits
// 9..7) and those seven bits: k + 100 where the double is an integer k from
// -99 to 151, else 253. Such a double is m * 2^(e - 7) with m = 0x80 | top
// seven bits, an integer exactly when the low 7 - e bits of m are zero.
// Entries 2048 and up are 253: they serve every other value.
struct SmallIntegerCodes {
  unsigned char code[4096];
};

constexpr SmallIntegerCodes MakeSmallIntegerCodes() {
  SmallIntegerCodes t{};
  for (int index = 2048; index < 4096; ++index) t.code[index] = kLiteral;
  for (int index = 0; index < 2048; ++index) {
    const int negative = index >> 10;
    const int exponent = (index >> 7) & 7;
    const int m = 0x80 | (index & 0x7F);
    const int shift = 7 - exponent;
    int code = kLiteral;
    if ((m & ((1 << shift) - 1)) == 0) {
      const int k = negative ? -(m >> shift) : (m >> shift);
      if (k + 100 >= 1 && k + 100 <= 251) code = k + 100;
    }
    t.code[index] = static_cast<unsigned char>(code);
  }
  return t;
}

inline constexpr SmallIntegerCodes kSmallIntegers = MakeSmallIntegerCodes();

// c ? a : b, computed with masks: the choices depend on data that mixes
// code classes at random, where a mispredicted branch costs more than both
// sides.
inline std::uint64_t Select64(bool c, std::uint64_t a, std::uint64_t b) {
  return b ^ ((a ^ b) & (0ull - static_cast<std::uint64_t>(c)));
}

// The code of one value, in this order of precedence: the system-missing
// value, eight blanks, +0.0, an integer from -99 to 151, else a literal.
// Written so that the compiler can keep it free of branches.
inline unsigned char ChooseCode(std::uint64_t v, std::uint64_t missing) {
  const std::uint32_t high = static_cast<std::uint32_t>(v >> 32);
  // The magnitude's high word relative to 1.0: exponents 0 to 7 give
  // 0 .. 0x7FFFFF, the rest wrap or exceed it.
  const std::uint32_t relative = (high & 0x7FFFFFFFu) - 0x3FF00000u;
  const std::uint32_t other = static_cast<std::uint32_t>(
      (relative > 0x7FFFFFu) | ((static_cast<std::uint32_t>(v) | (high & 0x1FFFu)) != 0));
  const std::uint32_t index =
      (other << 11) | ((high >> 21) & 0x400u) | ((relative >> 13) & 0x3FFu);
  unsigned char code = kSmallIntegers.code[index];
  code = v == 0 ? kZeroCode : code;
  code = v == kBlanks ? kBlankCode : code;
  code = v == missing ? kMissingCode : code;
  return code;
}

// Encodes k (1..8) values as one group at `out`, which has room for
// 8 + 8k bytes; returns one past the group. Unused control bytes are 0.
// The codes are chosen first, independently of one another, and the
// literals placed after, so the choice of one code does not wait for the
// position of the previous literal.
inline unsigned char* EncodeGroup(unsigned char* out, const unsigned char* values, unsigned k,
                                  std::uint64_t missing) {
  if (k == kGroup) {
    // A value with a nonzero low word that is neither blanks nor missing is
    // a literal; a whole group of them, common in numeric and text data, is
    // settled without choosing codes one by one.
    bool literals = true;
    for (unsigned i = 0; i < kGroup; ++i) {
      const std::uint64_t v = Load64(values + 8 * i);
      literals &= (static_cast<std::uint32_t>(v) != 0) & (v != kBlanks) & (v != missing);
    }
    if (literals) {
      Store64(out, kAllLiterals);
      std::memcpy(out + 8, values, 8 * kGroup);
      return out + 8 + 8 * kGroup;
    }
  }
  std::uint64_t control = 0;
  for (unsigned i = 0; i < k; ++i)
    control |= static_cast<std::uint64_t>(ChooseCode(Load64(values + 8 * i), missing)) << (8 * i);
  Store64(out, control);
  unsigned char* lit = out + 8;
  if (control == kAllLiterals) {  // eight literals
    std::memcpy(lit, values, 8 * kGroup);
    return lit + 8 * kGroup;
  }
  for (unsigned i = 0; i < k; ++i) {
    // Stored whatever the code: the slot lies within this group's room and
    // is overwritten by the next literal when this value is not one.
    std::memcpy(lit, values + 8 * i, 8);
    lit += ((control >> (8 * i)) & 0xFF) == kLiteral ? 8 : 0;
  }
  return lit;
}

// Encodes n values as whole groups at `out` (room VEXA_CompressedBound(n)).
inline unsigned char* EncodeRecord(unsigned char* out, const unsigned char* values,
                                   std::size_t n, std::uint64_t missing) {
  while (n >= kGroup) {
    out = EncodeGroup(out, values, kGroup, missing);
    values += 8 * kGroup;
    n -= kGroup;
  }
  if (n) out = EncodeGroup(out, values, static_cast<unsigned>(n), missing);
  return out;
}

// Mask of the first k control bytes' high bits.
inline std::uint64_t CodeMask(unsigned k) {
  return k >= 8 ? 0x8080808080808080ull : (0x8080808080808080ull & ((1ull << (8 * k)) - 1));
}
// High bit set in each byte of x that is zero, exactly.
inline std::uint64_t ZeroBytes(std::uint64_t x) {
  const std::uint64_t low7 = 0x7F7F7F7F7F7F7F7Full;
  return ~(((x & low7) + low7) | x | low7);
}
// Literals among the first k codes of the control block at `control`.
inline unsigned CountLiterals(std::uint64_t control, unsigned k) {
  return static_cast<unsigned>(
      __builtin_popcountll(ZeroBytes(control ^ kAllLiterals) & CodeMask(k)));
}
// True when one of the first k codes is undefined (0 or 252).
inline bool HasUndefined(std::uint64_t control, unsigned k) {
  return ((ZeroBytes(control) | ZeroBytes(control ^ 0xFCFCFCFCFCFCFCFCull)) & CodeMask(k)) != 0;
}

// Decodes k (1..8) values of the group whose control block is at `control`,
// with its literals following; the caller guarantees 8k readable bytes after
// the control block. Returns one past the group's literals. An undefined
// code yields `missing` and sets `damaged`.
inline const unsigned char* DecodeGroup(const unsigned char* control, unsigned k,
                                        unsigned char* values, std::uint64_t missing,
                                        bool& damaged) {
  const unsigned char* lit = control + 8;
  if (k == kGroup && Load64(control) == kAllLiterals) {
    std::memcpy(values, lit, 8 * kGroup);
    return lit + 8 * kGroup;
  }
  const std::uint64_t codes = Load64(control);
  // A group of small integers (codes 1 to 251, none 0 or 252 and up)
  // decodes by table lookups alone.
  const std::uint64_t high6 = 0xFCFCFCFCFCFCFCFCull;
  if (((ZeroBytes(codes) | ZeroBytes((codes & high6) ^ high6)) & CodeMask(k)) == 0) {
    for (unsigned i = 0; i < k; ++i) Store64(values + 8 * i, kTables.bits[control[i]]);
    return lit;
  }
  bool bad = false;
  for (unsigned i = 0; i < k; ++i) {
    const unsigned char c = control[i];
    const unsigned kind = kTables.kind[c];
    const bool literal = kind == kLiteralKind;
    // Loaded whatever the code: lit + 8 stays within the 8k bytes given.
    std::uint64_t v = Select64(kind >= kMissingKind, missing, kTables.bits[c]);
    v = Select64(literal, Load64(lit), v);
    lit += 8 * static_cast<unsigned>(literal);
    bad |= kind == kUndefined;
    Store64(values + 8 * i, v);
  }
  damaged |= bad;
  return lit;
}

// The length of the encoded record of n values at `data`, which holds at
// least VEXA_CompressedBound(n) bytes. `damaged` is set when a code among
// the values is undefined.
inline std::size_t RecordLength(const unsigned char* data, std::size_t n, bool& damaged) {
  const unsigned char* p = data;
  bool bad = false;
  while (n) {
    const unsigned k = n < kGroup ? static_cast<unsigned>(n) : kGroup;
    const std::uint64_t control = Load64(p);
    bad |= HasUndefined(control, k);
    p += 8 + 8 * CountLiterals(control, k);
    n -= k;
  }
  damaged |= bad;
  return static_cast<std::size_t>(p - data);
}

}  // namespace codec
}  // namespace vexahost

// The compressed case encoding on arbitrary bytes. Input: one byte for the
// values per record (1 to 64), one for the stream buffer size of the file
// path, then the encoded bytes.
//
// The same bytes are decoded record after record by the memory decoder, by
// ReadCompressed through a VEXA_InMemoryFile and through a VEXA_TempFile
// with a small buffer, and moved by CopyPrecompressed. All must agree on
// whether a record is sound and, when it is, on its values and its length;
// a sound record re-encoded decodes to the same values bit for bit. Nothing
// may read outside the data (the sanitizers watch). Temporary files go to
// the host's temporary directory (TMPDIR).
#include <cstdint>
#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <string>
#include <vector>

#include "host/hostsettings.h"
#include "isort/host/errhub.h"
#include "isort/host/iostore.h"

namespace {

[[noreturn]] void Fail(const char* what, std::size_t record) {
  std::fprintf(stderr, "codec disagreement: %s (record %zu)\n", what, record);
  std::abort();
}

bool Same(const std::vector<OBS>& a, const std::vector<OBS>& b) {
  return a.size() == b.size() && std::memcmp(a.data(), b.data(), a.size() * sizeof(OBS)) == 0;
}

}  // namespace

extern "C" int LLVMFuzzerTestOneInput(const std::uint8_t* input, std::size_t size) {
  if (size < 2) return 0;
  const std::size_t n = 1 + input[0] % 64;
  const unsigned buffer = 8u + (input[1] % 32) * 8u;
  const std::uint8_t* data = input + 2;
  size -= 2;
  const OBS* missing = vexahost::SystemMissing();

  VEXA_InMemoryFile memory(static_cast<unsigned int>(size % 97));
  if (size) memory.Write(data, static_cast<unsigned int>(size));
  memory.Seek(0, VEXA_StrBaseIO::SeekBegin);

  vexahost::SetStreamBufferSize(buffer);
  VEXA_TempFile file("fuzz", true);
  if (size) file.Write(data, static_cast<unsigned int>(size));
  file.Seek(0, VEXA_StrBaseIO::SeekBegin);
  vexahost::SetStreamBufferSize(0);

  VEXA_InMemoryFile copy(0);
  std::vector<OBS> a(n), b(n), c(n), d(n);
  std::size_t at = 0;  // where the memory decoder's record starts
  for (std::size_t record = 0; at < size && record < 64; ++record) {
    VEXA_CaseDecoder decoder;
    VEXA_DecodeStart(decoder, data + at, size - at);
    const bool okA = VEXA_DecodeValues(decoder, a.data(), n, missing);
    const std::size_t length = static_cast<std::size_t>(decoder.next - (data + at));
    if (length > size - at) Fail("memory decoder ran past the data", record);

    if (memory.Tell() != static_cast<std::int64_t>(at)) Fail("memory file position", record);
    const bool okB = ReadCompressed(memory, b.data(), static_cast<long>(n));
    bool okC;
    try {
      okC = ReadCompressed(file, c.data(), static_cast<long>(n));
    } catch (const ErrorText& e) {
      Fail(e.Text().c_str(), record);
    }
    VEXA_InMemoryFile source(0);
    source.Write(data + at, static_cast<unsigned int>(size - at));
    source.Seek(0, VEXA_StrBaseIO::SeekBegin);
    copy.Seek(0, VEXA_StrBaseIO::SeekBegin);
    const bool okD = CopyPrecompressed(source, copy, static_cast<long>(n));

    if (okA != okB || okA != okC || okA != okD) Fail("soundness", record);
    if (!okA) break;
    if (!Same(a, b) || !Same(a, c)) Fail("values", record);
    if (memory.Tell() != static_cast<std::int64_t>(at + length) ||
        file.Tell() != static_cast<std::int64_t>(at + length) ||
        source.Tell() != static_cast<std::int64_t>(length) ||
        copy.Tell() != static_cast<std::int64_t>(length))
      Fail("record length", record);
    copy.Seek(0, VEXA_StrBaseIO::SeekBegin);
    if (!ReadCompressed(copy, d.data(), static_cast<long>(n)) || !Same(a, d))
      Fail("copied record", record);

    // Re-encoded, a sound record decodes to the same bits.
    VEXA_InMemoryFile again(0);
    WriteCompressed(again, a.data(), static_cast<long>(n));
    if (again.Tell() > static_cast<std::int64_t>(VEXA_CompressedBound(n))) Fail("bound", record);
    again.Seek(0, VEXA_StrBaseIO::SeekBegin);
    if (!ReadCompressed(again, d.data(), static_cast<long>(n)) || !Same(a, d))
      Fail("round trip", record);
    at += length;
  }
  return 0;
}

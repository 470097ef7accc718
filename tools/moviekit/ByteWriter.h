// Big-endian byte building for the movies moviekit writes and for tests that
// need hand-made (often malformed) atoms.
#pragma once

#include <cstdint>
#include <string>
#include <string_view>
#include <vector>

namespace moviekit {

using Bytes = std::vector<uint8_t>;

void PutU8(Bytes& out, uint8_t value);
void PutU16(Bytes& out, uint16_t value);
void PutU24(Bytes& out, uint32_t value);
void PutU32(Bytes& out, uint32_t value);
void PutU64(Bytes& out, uint64_t value);
// Exactly four bytes; shorter strings are padded with spaces.
void PutType(Bytes& out, std::string_view type);
void PutBytes(Bytes& out, const Bytes& bytes);
void PutString(Bytes& out, std::string_view text);

// One atom as written: header (8 bytes, or 16 with a 64-bit size) and payload.
// `sizeOverride` writes a chosen (possibly wrong) size field instead of the true one.
struct AtomOptions {
    bool largeHeader = false;
    bool overrideSize = false;
    uint64_t sizeOverride = 0;
};
Bytes Atom(std::string_view type, const Bytes& payload, const AtomOptions& options = {});
// A container: the concatenation of already serialised children.
Bytes Container(std::string_view type, const std::vector<Bytes>& children, const AtomOptions& options = {});
Bytes Concat(const std::vector<Bytes>& parts);

}  // namespace moviekit

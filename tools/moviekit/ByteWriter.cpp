#include "ByteWriter.h"

namespace moviekit {

void PutU8(Bytes& out, uint8_t value) { out.push_back(value); }

void PutU16(Bytes& out, uint16_t value)
{
    out.push_back(static_cast<uint8_t>(value >> 8));
    out.push_back(static_cast<uint8_t>(value));
}

void PutU24(Bytes& out, uint32_t value)
{
    out.push_back(static_cast<uint8_t>(value >> 16));
    out.push_back(static_cast<uint8_t>(value >> 8));
    out.push_back(static_cast<uint8_t>(value));
}

void PutU32(Bytes& out, uint32_t value)
{
    PutU16(out, static_cast<uint16_t>(value >> 16));
    PutU16(out, static_cast<uint16_t>(value));
}

void PutU64(Bytes& out, uint64_t value)
{
    PutU32(out, static_cast<uint32_t>(value >> 32));
    PutU32(out, static_cast<uint32_t>(value));
}

void PutType(Bytes& out, std::string_view type)
{
    for (size_t i = 0; i < 4; ++i) {
        out.push_back(i < type.size() ? static_cast<uint8_t>(type[i]) : uint8_t{' '});
    }
}

void PutBytes(Bytes& out, const Bytes& bytes) { out.insert(out.end(), bytes.begin(), bytes.end()); }

void PutString(Bytes& out, std::string_view text) { out.insert(out.end(), text.begin(), text.end()); }

Bytes Atom(std::string_view type, const Bytes& payload, const AtomOptions& options)
{
    Bytes out;
    const uint64_t headerSize = options.largeHeader ? 16 : 8;
    const uint64_t size = options.overrideSize ? options.sizeOverride : headerSize + payload.size();
    out.reserve(headerSize + payload.size());
    if (options.largeHeader) {
        PutU32(out, 1);
        PutType(out, type);
        PutU64(out, size);
    } else {
        PutU32(out, static_cast<uint32_t>(size));
        PutType(out, type);
    }
    PutBytes(out, payload);
    return out;
}

Bytes Concat(const std::vector<Bytes>& parts)
{
    Bytes out;
    for (const Bytes& part : parts) {
        PutBytes(out, part);
    }
    return out;
}

Bytes Container(std::string_view type, const std::vector<Bytes>& children, const AtomOptions& options)
{
    return Atom(type, Concat(children), options);
}

}  // namespace moviekit

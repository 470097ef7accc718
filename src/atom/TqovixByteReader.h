// A bounds-checked cursor over an atom's payload: every read says whether the
// bytes were there, so a short or lying payload becomes a refusal, never a misread.
#pragma once

#include <cstdint>
#include <span>

#include "atom/TqovixEndian.h"

class TqovixByteReader {
public:
    explicit TqovixByteReader(std::span<const uint8_t> bytes) : m_bytes(bytes) {}

    uint64_t Position() const { return m_position; }
    uint64_t Remaining() const { return m_bytes.size() - m_position; }
    bool Has(uint64_t count) const { return count <= Remaining(); }

    bool Skip(uint64_t count)
    {
        if (!Has(count)) {
            return false;
        }
        m_position += count;
        return true;
    }
    bool U8(uint8_t& value) { return Take(1, [&](const uint8_t* p) { value = p[0]; }); }
    bool U16(uint16_t& value) { return Take(2, [&](const uint8_t* p) { value = TqovixReadBE16(p); }); }
    bool U32(uint32_t& value) { return Take(4, [&](const uint8_t* p) { value = TqovixReadBE32(p); }); }
    bool U64(uint64_t& value) { return Take(8, [&](const uint8_t* p) { value = TqovixReadBE64(p); }); }
    bool Bytes(uint64_t count, std::span<const uint8_t>& out)
    {
        return Take(count, [&](const uint8_t* p) { out = {p, static_cast<size_t>(count)}; });
    }
    // The rest of the payload from here on.
    std::span<const uint8_t> Rest() const { return m_bytes.subspan(static_cast<size_t>(m_position)); }

private:
    template <typename Read>
    bool Take(uint64_t count, Read&& read)
    {
        if (!Has(count)) {
            return false;
        }
        read(m_bytes.data() + m_position);
        m_position += count;
        return true;
    }

    std::span<const uint8_t> m_bytes;
    uint64_t m_position = 0;
};

// Byte-order helpers: movie files are big-endian, the host is little-endian.
// Numbers are swapped right after reading and right before writing.
#pragma once

#include <cstdint>
#include <cstring>

inline void EndianSwap16(uint16_t& value) { value = __builtin_bswap16(value); }
inline void EndianSwap32(uint32_t& value) { value = __builtin_bswap32(value); }
inline void EndianSwap64(uint64_t& value) { value = __builtin_bswap64(value); }

// Reads of big-endian numbers from a byte buffer the caller has bounds-checked.
inline uint16_t TqovixReadBE16(const uint8_t* bytes)
{
    uint16_t value;
    std::memcpy(&value, bytes, sizeof value);
    EndianSwap16(value);
    return value;
}

inline uint32_t TqovixReadBE32(const uint8_t* bytes)
{
    uint32_t value;
    std::memcpy(&value, bytes, sizeof value);
    EndianSwap32(value);
    return value;
}

inline uint64_t TqovixReadBE64(const uint8_t* bytes)
{
    uint64_t value;
    std::memcpy(&value, bytes, sizeof value);
    EndianSwap64(value);
    return value;
}

inline void TqovixWriteBE16(uint8_t* bytes, uint16_t value)
{
    EndianSwap16(value);
    std::memcpy(bytes, &value, sizeof value);
}

inline void TqovixWriteBE32(uint8_t* bytes, uint32_t value)
{
    EndianSwap32(value);
    std::memcpy(bytes, &value, sizeof value);
}

inline void TqovixWriteBE64(uint8_t* bytes, uint64_t value)
{
    EndianSwap64(value);
    std::memcpy(bytes, &value, sizeof value);
}

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

// Reverses the bytes of each whole `width`-byte sample of PCM; the start of a sample that the
// buffer cuts off is left as it is.
inline void TqovixSwapSamples(uint8_t* bytes, uint64_t size, unsigned width)
{
    const uint64_t whole = width == 0 ? 0 : size - size % width;
    switch (width) {
    case 2:
        for (uint64_t k = 0; k < whole; k += 2) {
            const uint8_t first = bytes[k];
            bytes[k] = bytes[k + 1];
            bytes[k + 1] = first;
        }
        break;
    case 3:
        for (uint64_t k = 0; k < whole; k += 3) {
            const uint8_t first = bytes[k];
            bytes[k] = bytes[k + 2];
            bytes[k + 2] = first;
        }
        break;
    case 4:
        for (uint64_t k = 0; k < whole; k += 4) {
            uint32_t value;
            std::memcpy(&value, bytes + k, 4);
            EndianSwap32(value);
            std::memcpy(bytes + k, &value, 4);
        }
        break;
    case 8:
        for (uint64_t k = 0; k < whole; k += 8) {
            uint64_t value;
            std::memcpy(&value, bytes + k, 8);
            EndianSwap64(value);
            std::memcpy(bytes + k, &value, 8);
        }
        break;
    default:
        for (uint64_t k = 0; k < whole; k += width) {
            for (unsigned a = 0, b = width - 1; a < b; ++a, --b) {
                const uint8_t first = bytes[k + a];
                bytes[k + a] = bytes[k + b];
                bytes[k + b] = first;
            }
        }
        break;
    }
}

// A FIFO of bytes that hands its storage back as it drains: pops advance a
// read position, the consumed front is dropped once it outweighs what is left,
// and an empty queue holds no storage at all.
#pragma once

#include <cstddef>
#include <cstdint>
#include <vector>

#include "bridge/TqovixErrorCode.h"

class TqovixByteQueue {
public:
    uint64_t Size() const { return m_bytes.size() - m_head; }
    const uint8_t* Data() const { return m_bytes.data() + m_head; }
    // Bytes of storage held, consumed or not; what memory tests watch.
    uint64_t Capacity() const { return m_bytes.capacity(); }

    // 4352 when the bytes cannot be held.
    eTqovixErrorCode Push(const void* data, uint64_t size);
    // Copies up to `requested` bytes from the front; returns the count.
    uint64_t Pop(void* buffer, uint64_t requested);
    void Clear();

private:
    void Compact();

    std::vector<uint8_t> m_bytes;
    size_t m_head = 0;
};

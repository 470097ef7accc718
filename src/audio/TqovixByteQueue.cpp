#include "audio/TqovixByteQueue.h"

#include <algorithm>
#include <cstring>
#include <new>
#include <stdexcept>

eTqovixErrorCode TqovixByteQueue::Push(const void* data, uint64_t size)
{
    Compact();
    try {
        const auto* bytes = static_cast<const uint8_t*>(data);
        m_bytes.insert(m_bytes.end(), bytes, bytes + size);
    } catch (const std::bad_alloc&) {
        return eTqovixErrorOutOfMemory;
    } catch (const std::length_error&) {
        return eTqovixErrorOutOfMemory;
    }
    return eTqovixSuccess;
}

uint64_t TqovixByteQueue::Pop(void* buffer, uint64_t requested)
{
    const uint64_t count = std::min(requested, Size());
    if (count == 0) {
        return 0;
    }
    std::memcpy(buffer, m_bytes.data() + m_head, count);
    m_head += count;
    if (m_head == m_bytes.size()) {
        Clear();
    } else if (m_head >= m_bytes.size() / 2) {
        Compact();
    }
    return count;
}

void TqovixByteQueue::Clear()
{
    std::vector<uint8_t>().swap(m_bytes);
    m_head = 0;
}

void TqovixByteQueue::Compact()
{
    if (m_head == 0) {
        return;
    }
    // Moving the rest down and trimming keeps at most twice what is queued.
    m_bytes.erase(m_bytes.begin(), m_bytes.begin() + static_cast<std::ptrdiff_t>(m_head));
    m_head = 0;
    m_bytes.shrink_to_fit();
}

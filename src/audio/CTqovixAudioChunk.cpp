#include "audio/CTqovixAudioChunk.h"

#include <algorithm>

#include "file/CTqovixFile.h"

eTqovixErrorCode CTqovixAudioChunk::Initialize(CTqovixFile& file, const TqovixChunkInformation& information)
{
    m_pFile = &file;
    m_chunkInformation = information;
    m_readPosition = information.offset;
    return eTqovixSuccess;
}

void CTqovixAudioChunk::Close()
{
    m_readPosition = 0;
    m_decodedData.Clear();
    m_pFile = nullptr;
}

uint64_t CTqovixAudioChunk::GetInputDataSize() const
{
    const uint64_t end = m_chunkInformation.offset + m_chunkInformation.size;
    return end > m_readPosition ? end - m_readPosition : 0;
}

eTqovixErrorCode CTqovixAudioChunk::PopInputData(void* buffer, unsigned int* size, unsigned int requested)
{
    if (buffer == nullptr || size == nullptr || requested == 0 || m_pFile == nullptr || !m_pFile->IsOpened()) {
        return eTqovixErrorInternal;
    }
    const auto count = static_cast<unsigned int>(std::min<uint64_t>(requested, GetInputDataSize()));
    if (m_readPosition > static_cast<uint64_t>(INT64_MAX)) {
        return eTqovixErrorInvalidMovie;
    }
    // Straight into the caller's buffer, at the chunk's own place: a chunk is always read
    // whole, so neither a queue nor the stream's read-ahead would serve it.
    unsigned int got = 0;
    const eTqovixErrorCode result = m_pFile->ReadAt(m_readPosition, buffer, count, &got);
    if (TqovixFailed(result)) {
        return result;
    }
    *size = got;
    m_readPosition += got;
    return eTqovixSuccess;
}

eTqovixErrorCode CTqovixAudioChunk::PopDecodedData(void* buffer, unsigned long* size, unsigned long long requested)
{
    if (buffer == nullptr || size == nullptr || requested == 0) {
        return eTqovixErrorInternal;
    }
    *size = m_decodedData.Pop(buffer, requested);
    return eTqovixSuccess;
}

eTqovixErrorCode CTqovixAudioChunk::PushDecodedData(const void* data, unsigned long long size)
{
    if (data == nullptr || size == 0) {
        return eTqovixErrorInternal;
    }
    return m_decodedData.Push(data, size);
}

uint32_t CTqovixAudioChunk::GetSampleSize(int index) const
{
    if (index < 0 || static_cast<size_t>(index) >= m_chunkInformation.sampleSizes.size()) {
        return 0;
    }
    return m_chunkInformation.sampleSizes[static_cast<size_t>(index)];
}

uint64_t CTqovixAudioChunk::GetHeldByteCount() const
{
    return m_decodedData.Capacity();
}

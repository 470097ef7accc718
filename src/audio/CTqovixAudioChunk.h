// One chunk of the source's sound track: where it lies, its sample sizes, and
// the queue its sound waits in once read and decoded.
#pragma once

#include <cstdint>

#include "audio/TqovixByteQueue.h"
#include "bridge/TqovixErrorCode.h"
#include "visitor/TqovixChunkInformation.h"

class CTqovixFile;

class CTqovixAudioChunk {
public:
    eTqovixErrorCode Initialize(CTqovixFile& file, const TqovixChunkInformation& information);
    void Close();

    uint64_t GetInputDataSize() const;
    eTqovixErrorCode PopInputData(void* buffer, unsigned int* size, unsigned int requested);

    uint64_t GetDecodedDataSize() const { return m_decodedData.Size(); }
    eTqovixErrorCode PopDecodedData(void* buffer, unsigned long* size, unsigned long long requested);
    eTqovixErrorCode PushDecodedData(const void* data, unsigned long long size);

    uint32_t GetSampleSize(int index) const;
    const TqovixChunkInformation& GetChunkInformation() const { return m_chunkInformation; }
    // Storage held by the queue, for tests that watch memory.
    uint64_t GetHeldByteCount() const;

private:
    CTqovixFile* m_pFile = nullptr;
    TqovixChunkInformation m_chunkInformation;
    TqovixByteQueue m_decodedData;
    uint64_t m_readPosition = 0;
};

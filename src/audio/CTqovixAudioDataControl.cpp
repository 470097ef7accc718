#include "audio/CTqovixAudioDataControl.h"

#include <algorithm>
#include <cstring>
#include <new>
#include <stdexcept>

#include "atom/TqovixEndian.h"
#include "file/CTqovixFile.h"

namespace {


// Grows a scratch buffer without value-initialising what is overwritten anyway.
eTqovixErrorCode Reserve(std::vector<uint8_t>& buffer, size_t size)
{
    try {
        if (buffer.size() < size) {
            buffer.resize(size);
        }
    } catch (const std::bad_alloc&) {
        return eTqovixErrorOutOfMemory;
    } catch (const std::length_error&) {
        return eTqovixErrorOutOfMemory;
    }
    return eTqovixSuccess;
}

}  // namespace

CTqovixAudioDataControl::~CTqovixAudioDataControl() = default;

eTqovixErrorCode CTqovixAudioDataControl::Initialize(CTqovixFile& file, const std::vector<TqovixChunkInformation>& chunks,
                                                     bool bigEndian, unsigned int sampleBytes)
{
    if (chunks.empty() || sampleBytes == 0 || sampleBytes > kMaxSampleBytes) {
        return eTqovixErrorInternal;
    }
    m_chunks.resize(chunks.size());
    for (size_t i = 0; i < chunks.size(); ++i) {
        m_chunks[i] = std::make_shared<CTqovixAudioChunk>();
        const eTqovixErrorCode result = m_chunks[i]->Initialize(file, chunks[i]);
        if (TqovixFailed(result)) {
            return result;
        }
    }
    m_decodedPool = std::make_shared<CTqovixAudioChunk>();
    const eTqovixErrorCode result = m_decodedPool->Initialize(file, TqovixChunkInformation{});
    if (TqovixFailed(result)) {
        return result;
    }
    m_bBigEndian = bigEndian;
    m_sampleBytes = sampleBytes;
    return eTqovixSuccess;
}

eTqovixErrorCode CTqovixAudioDataControl::Close()
{
    for (const auto& chunk : m_chunks) {
        chunk->Close();
    }
    m_chunks.clear();
    if (m_decodedPool) {
        m_decodedPool->Close();
        m_decodedPool.reset();
    }
    CloseDecoderAAC();
    CloseEncoderAAC();
    m_inputChunkIndex = 0;
    m_outputChunkIndex = 0;
    m_bBigEndian = true;
    m_sampleBytes = 2;
    std::vector<uint8_t>().swap(m_scratch);
    m_scratchHead = 0;
    m_scratchFill = 0;
    m_packetIndex = 0;
    m_bChunkChecked = false;
    return eTqovixSuccess;
}

void CTqovixAudioDataControl::NextChunk()
{
    ++m_inputChunkIndex;
    m_scratchHead = 0;
    m_scratchFill = 0;
    m_packetIndex = 0;
    m_bChunkChecked = false;
}

eTqovixErrorCode CTqovixAudioDataControl::ServePcmPiece(CTqovixAudioChunk& chunk)
{
    // Whole samples a piece, so that none straddles two of them.
    const unsigned int piece = kReadPieceBytes - kReadPieceBytes % m_sampleBytes;
    const auto size = static_cast<unsigned int>(std::min<uint64_t>(chunk.GetInputDataSize(), piece));
    eTqovixErrorCode result = Reserve(m_scratch, size);
    if (TqovixFailed(result)) {
        return result;
    }
    unsigned int got = 0;
    result = chunk.PopInputData(m_scratch.data(), &got, size);
    if (TqovixFailed(result)) {
        return result;
    }
    if (got == 0) {
        return eTqovixErrorInternal;  // the file ends before this chunk
    }
    if (m_bBigEndian) {
        TqovixSwapSamples(m_scratch.data(), got, m_sampleBytes);
    }
    return TqovixFailed(m_decodedPool->PushDecodedData(m_scratch.data(), got)) ? eTqovixErrorInternal
                                                                             : eTqovixSuccess;
}

eTqovixErrorCode CTqovixAudioDataControl::DecodeNextPacket(CTqovixAudioChunk& chunk)
{
    const uint64_t chunkSize = chunk.GetChunkInformation().size;
    if (!m_bChunkChecked) {
        // Sizes that do not add up to the chunk must not read past it or stall; checked before
        // any of its sound is served, so that a bad table gives none of it.
        uint64_t total = 0;
        for (int k = 0; total < chunkSize; ++k) {
            const uint32_t packetSize = chunk.GetSampleSize(k);
            if (packetSize == 0 || packetSize > chunkSize - total || packetSize > kReadPieceBytes) {
                return eTqovixErrorInternal;
            }
            total += packetSize;
        }
        m_bChunkChecked = true;
    }
    const uint32_t packetSize = chunk.GetSampleSize(static_cast<int>(m_packetIndex));
    const size_t held = m_scratchFill - m_scratchHead;
    if (packetSize == 0 || packetSize > held + chunk.GetInputDataSize() || packetSize > kReadPieceBytes) {
        return eTqovixErrorInternal;
    }
    if (held < packetSize) {
        // The undecoded tail moves to the front and the chunk's next bytes follow it.
        if (held != 0) {
            std::memmove(m_scratch.data(), m_scratch.data() + m_scratchHead, held);
        }
        m_scratchHead = 0;
        m_scratchFill = held;
        const auto want =
            static_cast<unsigned int>(std::min<uint64_t>(chunk.GetInputDataSize(), kReadPieceBytes - held));
        eTqovixErrorCode result = Reserve(m_scratch, held + want);
        if (TqovixFailed(result)) {
            return result;
        }
        unsigned int got = 0;
        result = chunk.PopInputData(m_scratch.data() + held, &got, want);
        if (TqovixFailed(result)) {
            return result;
        }
        m_scratchFill += got;
        if (m_scratchFill < packetSize) {
            return eTqovixErrorInternal;  // the file ends inside this chunk
        }
    }
    uint8_t block[kDecodedPacketBytes];
    unsigned int pcmSize = 0;
    unsigned int used = 0;
    const eTqovixErrorCode result =
        DecodeAAC2PCM(block, &pcmSize, &used, m_scratch.data() + m_scratchHead, packetSize);
    if (TqovixFailed(result)) {
        return result;
    }
    if (used == 0 || used > packetSize || pcmSize > kDecodedPacketBytes) {
        return eTqovixErrorInternal;
    }
    m_scratchHead += used;
    ++m_packetIndex;
    if (pcmSize == 0) {
        return eTqovixSuccess;
    }
    return TqovixFailed(m_decodedPool->PushDecodedData(block, pcmSize)) ? eTqovixErrorInternal : eTqovixSuccess;
}

eTqovixErrorCode CTqovixAudioDataControl::FillPool(unsigned long requested)
{
    // A piece or a packet at a time, however large the chunk: the pool ends at most one piece
    // past the request.
    while (m_decodedPool->GetDecodedDataSize() < requested && m_inputChunkIndex < m_chunks.size()) {
        CTqovixAudioChunk& chunk = *m_chunks[m_inputChunkIndex];
        if (chunk.GetInputDataSize() == 0 && m_scratchHead == m_scratchFill) {
            NextChunk();
            continue;
        }
        const eTqovixErrorCode result = IsAACCodec() ? DecodeNextPacket(chunk) : ServePcmPiece(chunk);
        if (TqovixFailed(result)) {
            return result;
        }
    }
    return eTqovixSuccess;
}

eTqovixErrorCode CTqovixAudioDataControl::PopAudioData(void* buffer, unsigned long* size, unsigned long requested)
{
    if (buffer == nullptr || size == nullptr || requested == 0 || !m_decodedPool) {
        return eTqovixErrorInternal;
    }
    const bool aac = IsAACCodec();
    if (aac) {
        std::memset(buffer, 0, requested);
    }
    eTqovixErrorCode result = FillPool(requested);
    if (TqovixFailed(result)) {
        return result;
    }
    result = m_decodedPool->PopDecodedData(buffer, size, requested);
    if (TqovixFailed(result)) {
        return result;
    }
    // AAC never ends by itself: past the track the caller gets silence.
    if (aac && *size < requested) {
        *size = requested;
    }
    return eTqovixSuccess;
}

eTqovixErrorCode CTqovixAudioDataControl::PushAudioData(const void* data, unsigned long size)
{
    if (data == nullptr || size == 0 || m_chunks.empty()) {
        return eTqovixErrorInternal;
    }
    // PCM goes straight from the writer to the file; only AAC passes through here.
    if (!IsAACCodec()) {
        return eTqovixErrorInternal;
    }
    // Encoded packets reach the writer inside this call; it may announce the end.
    const eTqovixErrorCode result = EncodePCM2AAC(const_cast<void*>(data), static_cast<unsigned int>(size));
    if (TqovixFailed(result) || m_outputChunkIndex < m_chunks.size()) {
        return result;
    }
    const eTqovixErrorCode flushed = EncodeDone();
    return TqovixFailed(flushed) ? eTqovixErrorInternal : flushed;
}

eTqovixErrorCode CTqovixAudioDataControl::SetOutputChunkIndex(unsigned long index)
{
    m_outputChunkIndex = static_cast<uint32_t>(index);
    return eTqovixSuccess;
}

eTqovixErrorCode CTqovixAudioDataControl::SetAACInformation(
    const CTqovixMovControl* movControl, const void* audioSpecificConfig, unsigned int audioSpecificConfigSize,
    const TqovixInterfaceConvert::TqovixAudioInformation& information, unsigned int bitRate)
{
    if (audioSpecificConfig == nullptr || audioSpecificConfigSize == 0) {
        return eTqovixErrorInternal;
    }
    const eTqovixErrorCode result = OpenDecoderAAC(audioSpecificConfig, audioSpecificConfigSize);
    if (TqovixFailed(result)) {
        return result;
    }
    const eTqovixErrorCode encoder = OpenEncoderAAC(movControl, information, bitRate);
    return TqovixFailed(encoder) ? encoder : eTqovixSuccess;
}

eTqovixErrorCode CTqovixAudioDataControl::OpenDecoderAAC(const void*, unsigned int) { return eTqovixSuccess; }

eTqovixErrorCode CTqovixAudioDataControl::OpenEncoderAAC(const CTqovixMovControl*,
                                                         const TqovixInterfaceConvert::TqovixAudioInformation&,
                                                         unsigned int)
{
    return eTqovixSuccess;
}

eTqovixErrorCode CTqovixAudioDataControl::DecodeAAC2PCM(void*, unsigned int*, unsigned int*, const void*, unsigned int)
{
    return eTqovixSuccess;
}

eTqovixErrorCode CTqovixAudioDataControl::EncodePCM2AAC(void*, unsigned int) { return eTqovixSuccess; }

eTqovixErrorCode CTqovixAudioDataControl::EncodeDone() { return eTqovixSuccess; }

uint64_t CTqovixAudioDataControl::GetHeldByteCount() const
{
    uint64_t total = m_scratch.capacity();
    for (const auto& chunk : m_chunks) {
        total += chunk->GetHeldByteCount();
    }
    return total + (m_decodedPool ? m_decodedPool->GetHeldByteCount() : 0);
}

// Serves the sound track to the processing library as PCM, chunk by chunk in
// table order (byte-swapped or decoded as needed), and hands processed PCM to
// the encoder. By itself it handles PCM; a derived class binds the AAC codecs.
#pragma once

#include <cstdint>
#include <memory>
#include <vector>

#include "audio/CTqovixAudioChunk.h"

class CTqovixFile;
class CTqovixMovControl;
namespace TqovixInterfaceConvert {
struct TqovixAudioInformation;
}

class CTqovixAudioDataControl {
public:
    // The largest PCM one AAC packet decodes to (1024 frames of up to 8 channels of 48 bits).
    static constexpr unsigned int kDecodedPacketBytes = 49152;
    // What one read from the file takes at most; whatever a chunk's size, no more is held
    // (a source packet larger than this is no sound packet).
    static constexpr unsigned int kReadPieceBytes = 1 << 20;
    // The widest PCM sample served: a 64-bit float.
    static constexpr unsigned int kMaxSampleBytes = 8;

    virtual ~CTqovixAudioDataControl();

    // Big-endian PCM is served reversed in units of `sampleBytes`, the width of one sample.
    virtual eTqovixErrorCode Initialize(CTqovixFile& file, const std::vector<TqovixChunkInformation>& chunks,
                                        bool bigEndian, unsigned int sampleBytes = 2);
    virtual eTqovixErrorCode Close();
    virtual eTqovixErrorCode PopAudioData(void* buffer, unsigned long* size, unsigned long requested);
    virtual eTqovixErrorCode PushAudioData(const void* data, unsigned long size);
    virtual bool IsInitialized() const { return !m_chunks.empty(); }
    virtual eTqovixErrorCode SetOutputChunkIndex(unsigned long index);
    virtual eTqovixErrorCode SetAACInformation(const CTqovixMovControl* movControl, const void* audioSpecificConfig,
                                               unsigned int audioSpecificConfigSize,
                                               const TqovixInterfaceConvert::TqovixAudioInformation& information,
                                               unsigned int bitRate);
    virtual eTqovixErrorCode OpenDecoderAAC(const void* audioSpecificConfig, unsigned int audioSpecificConfigSize);
    virtual eTqovixErrorCode OpenEncoderAAC(const CTqovixMovControl* movControl,
                                            const TqovixInterfaceConvert::TqovixAudioInformation& information,
                                            unsigned int bitRate);
    virtual void CloseDecoderAAC() {}
    virtual void CloseEncoderAAC() {}
    virtual eTqovixErrorCode DecodeAAC2PCM(void* pcm, unsigned int* pcmSize, unsigned int* usedSize,
                                           const void* packet, unsigned int packetSize);
    virtual eTqovixErrorCode EncodePCM2AAC(void* pcm, unsigned int pcmSize);
    virtual eTqovixErrorCode EncodeDone();
    virtual bool IsAACCodec() { return false; }

    // Storage held by the chunks and the pool, for tests that watch memory.
    uint64_t GetHeldByteCount() const;

private:
    eTqovixErrorCode FillPool(unsigned long requested);
    eTqovixErrorCode ServePcmPiece(CTqovixAudioChunk& chunk);
    eTqovixErrorCode DecodeNextPacket(CTqovixAudioChunk& chunk);
    void NextChunk();

    std::vector<std::shared_ptr<CTqovixAudioChunk>> m_chunks;
    std::shared_ptr<CTqovixAudioChunk> m_decodedPool;
    bool m_bBigEndian = true;
    unsigned int m_sampleBytes = 2;
    uint32_t m_inputChunkIndex = 0;
    uint32_t m_outputChunkIndex = 0;
    // At most one piece of the current chunk's bytes, read ahead of the decoder; a chunk's
    // size comes from the file, so it never decides how much is held.
    std::vector<uint8_t> m_scratch;
    size_t m_scratchHead = 0;
    size_t m_scratchFill = 0;
    uint32_t m_packetIndex = 0;  // the next packet of the current chunk
    bool m_bChunkChecked = false;
};

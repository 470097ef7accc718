// Processed PCM to AAC packets through a platform audio converter. Pushes of any size
// are cut into 4096-byte blocks, one packet each, handed at once to the stream's result
// procedure; the first 4352 bytes are dropped, and the flush appends 4096 bytes of silence.
#pragma once

#include <memory>

#include "codec/ACEncoderStream.h"
#include "codec/AudioConverterBase.h"

class AACEncoder : public AudioConverterBase {
public:
    static constexpr unsigned int kBlockSize = 4096;
    // The platform encoder primes 2112 frames; dropping 1088 stereo frames here as well
    // as one packet in the decoder puts the processed sound where the source's was.
    static constexpr unsigned int kFirstBlockSize = 4352;
    static constexpr unsigned int kOwnBufferSize = 32768;
    static constexpr unsigned int kSilenceSize = 4096;

    AACEncoder();
    ~AACEncoder() override;

    using AudioConverterBase::Initialize;
    // `stream` (not owned) must outlive the encoder; `bitRate` 0 keeps the converter's own.
    virtual eConverterErrorCode Initialize(const ACFormat& input, const ACFormat& output, unsigned int bitRate,
                                           const ACEncoderStream* stream);
    // One push of PCM; fewer than 4096 bytes left over wait for the next push.
    virtual eConverterErrorCode Encode(void* pcm, unsigned int pcmSize);
    // One block into one packet, written into `aac` (room for kBlockSize bytes).
    virtual eConverterErrorCode Encode(void* aac, unsigned int* aacSize, unsigned int* usedSize, const void* pcm,
                                       unsigned int pcmSize);
    // The end of the track: what is held, then silence.
    virtual eConverterErrorCode EncodeDone();

    eConverterErrorCode SetEncodeBitRate(unsigned int bitRate);

    static OSStatus EncoderDataProc(AudioConverterRef converter, UInt32* ioNumberDataPackets,
                                    AudioBufferList* ioData, AudioStreamPacketDescription** outPacketDescription,
                                    void* userData);

protected:
    const ACEncoderStream* m_pStream;
    unsigned int m_encodedBlocks;
    std::unique_ptr<unsigned char[]> m_pRemainder;
    unsigned int m_remainderSize;

private:
    class OutputBuffer;

    eConverterErrorCode GetOutputBuffer(OutputBuffer& output) const;
    // Encodes one block and hands the packet over; a block the converter refused is not counted.
    eConverterErrorCode EncodeBlock(OutputBuffer& output, const unsigned char* block, unsigned int size);
    unsigned int HeldSize() const;
};

// Processed PCM to AAC packets through a platform audio converter. Pushes of any size
// are cut into blocks of 1024 frames, one packet each, handed at once to the stream's
// result procedure; the first 1088 frames are dropped, and the flush appends one block
// of silence. Block, drop and silence follow the input's frame size.
#pragma once

#include <cstdint>
#include <memory>

#include "codec/ACEncoderStream.h"
#include "codec/AudioConverterBase.h"

class AACEncoder : public AudioConverterBase {
public:
    static constexpr unsigned int kFramesPerPacket = 1024;
    // The platform encoder primes 2112 frames; dropping 1088 frames here as well as one
    // packet in the decoder puts the processed sound exactly where the source's was.
    static constexpr unsigned int kDroppedFrames = 1088;
    // Room for one packet, whatever the channel count.
    static constexpr unsigned int kBlockSize = 4096;
    static constexpr unsigned int kOwnBufferSize = 32768;
    // The shape the platform encoder gives its plain long windows (Kaiser-Bessel derived); a
    // decoder carries a frame's shape into the next one's first half, so packets of ours only
    // follow those of an encoder that shapes its long windows alike.
    static constexpr uint8_t kLongWindowShape = 1;

    AACEncoder();
    ~AACEncoder() override;

    using AudioConverterBase::Initialize;
    // `stream` (not owned) must outlive the encoder; `bitRate` 0 keeps the converter's own.
    virtual eConverterErrorCode Initialize(const ACFormat& input, const ACFormat& output, unsigned int bitRate,
                                           const ACEncoderStream* stream);
    // One push of PCM; less than a block left over waits for the next push.
    virtual eConverterErrorCode Encode(void* pcm, unsigned int pcmSize);
    // One block into one packet, written into `aac` (room for kBlockSize bytes).
    virtual eConverterErrorCode Encode(void* aac, unsigned int* aacSize, unsigned int* usedSize, const void* pcm,
                                       unsigned int pcmSize);
    // The end of the track: what is held, then silence.
    virtual eConverterErrorCode EncodeDone();

    eConverterErrorCode SetEncodeBitRate(unsigned int bitRate);
    // After Initialize, before the first push: how many frames to drop instead of kDroppedFrames
    // (a span re-encoded from within the track keeps them all and places itself).
    void SetDroppedFrames(unsigned int frames);

    static OSStatus EncoderDataProc(AudioConverterRef converter, UInt32* ioNumberDataPackets,
                                    AudioBufferList* ioData, AudioStreamPacketDescription** outPacketDescription,
                                    void* userData);

protected:
    const ACEncoderStream* m_pStream;
    unsigned int m_encodedBlocks;
    std::unique_ptr<unsigned char[]> m_pRemainder;
    unsigned int m_remainderSize;
    unsigned int m_blockBytes = 0;    // 1024 frames of the input
    uint64_t m_dropBytes = 0;         // 1088 frames of the input
    uint64_t m_droppedBytes = 0;      // dropped so far, across pushes
    std::unique_ptr<unsigned char[]> m_straddling;  // a block that starts in the remainder

private:
    class OutputBuffer;

    eConverterErrorCode GetOutputBuffer(OutputBuffer& output) const;
    // Encodes one block and hands the packet over; a block the converter refused is not counted.
    eConverterErrorCode EncodeBlock(OutputBuffer& output, const unsigned char* block, unsigned int size);
    unsigned int HeldSize() const;
};

#include "codec/AACEncoder.h"

#include <algorithm>
#include <cstring>
#include <new>

namespace {

// What EncoderDataProc offers, again on every call.
struct EncoderInput {
    const void* pcm;
    unsigned int pcmSize;
    AudioStreamBasicDescription description;
    AudioStreamPacketDescription packetDescription;
};

std::unique_ptr<unsigned char[]> AllocateBytes(size_t size)
{
    try {
        return std::make_unique_for_overwrite<unsigned char[]>(size);
    } catch (const std::bad_alloc&) {
        return nullptr;
    }
}

}  // namespace

// The buffer packets are written into for one push or flush: lent by the stream, or
// the encoder's own for the length of the call.
class AACEncoder::OutputBuffer {
public:
    unsigned char* m_data = nullptr;
    std::unique_ptr<unsigned char[]> m_own;
};

AACEncoder::AACEncoder() : m_pStream(nullptr), m_encodedBlocks(0), m_remainderSize(0)
{
}

AACEncoder::~AACEncoder() = default;

eConverterErrorCode AACEncoder::Initialize(const ACFormat& input, const ACFormat& output, unsigned int bitRate,
                                           const ACEncoderStream* stream)
{
    eConverterErrorCode result = AudioConverterBase::Initialize(input, output);
    if (result != eConverterSuccess) {
        return result;
    }
    m_pStream = stream;
    const unsigned int frameBytes = m_inputDescription.mBytesPerFrame;
    if (frameBytes == 0 || frameBytes > 16) {
        CloseConverter();
        return eConverterInternal;
    }
    m_blockBytes = kFramesPerPacket * frameBytes;
    m_dropBytes = uint64_t{kDroppedFrames} * frameBytes;
    m_droppedBytes = 0;
    m_encodedBlocks = 0;
    m_pRemainder.reset();
    m_remainderSize = 0;
    m_straddling = AllocateBytes(m_blockBytes);
    if (m_straddling == nullptr) {
        CloseConverter();
        return static_cast<eConverterErrorCode>(eTqovixErrorOutOfMemory);
    }
    if (bitRate == 0) {
        return eConverterSuccess;
    }
    result = SetEncodeBitRate(bitRate);
    if (result != eConverterSuccess) {
        CloseConverter();
    }
    return result;
}

eConverterErrorCode AACEncoder::SetEncodeBitRate(unsigned int bitRate)
{
    return SetACProperty(kAudioConverterEncodeBitRate, sizeof bitRate, &bitRate);
}

void AACEncoder::SetDroppedFrames(unsigned int frames)
{
    m_dropBytes = uint64_t{frames} * m_inputDescription.mBytesPerFrame;
}

unsigned int AACEncoder::HeldSize() const
{
    return m_pRemainder != nullptr ? m_remainderSize : 0;
}

eConverterErrorCode AACEncoder::GetOutputBuffer(OutputBuffer& output) const
{
    eConverterErrorCode result = eConverterSuccess;
    if (m_pStream->requestProc != nullptr) {
        UInt32 maximum = 0;
        unsigned int size = sizeof maximum;
        result = GetACProperty(kAudioConverterPropertyMaximumOutputPacketSize, &size, &maximum);
        if (result != eConverterSuccess) {
            maximum = 0;
        }
        output.m_data = m_pStream->requestProc(const_cast<ACEncoderStream*>(m_pStream), maximum);
    }
    if (output.m_data == nullptr) {
        output.m_own = AllocateBytes(kOwnBufferSize);
        if (output.m_own == nullptr) {
            return static_cast<eConverterErrorCode>(eTqovixErrorOutOfMemory);
        }
        output.m_data = output.m_own.get();
    }
    return result;
}

eConverterErrorCode AACEncoder::EncodeBlock(OutputBuffer& output, const unsigned char* block, unsigned int size)
{
    unsigned int aacSize = 0;
    unsigned int used = 0;
    eConverterErrorCode result = Encode(output.m_data, &aacSize, &used, block, size);
    if (result != eConverterSuccess) {
        return result;
    }
    ++m_encodedBlocks;
    if (m_pStream->resultProc != nullptr) {
        const eTqovixErrorCode delivered =
            m_pStream->resultProc(const_cast<ACEncoderStream*>(m_pStream), output.m_data, aacSize);
        if (TqovixFailed(delivered)) {
            result = static_cast<eConverterErrorCode>(delivered);
        }
    }
    return result;
}

eConverterErrorCode AACEncoder::Encode(void* pcm, unsigned int pcmSize)
{
    if (m_pStream == nullptr || m_straddling == nullptr || (pcm == nullptr && pcmSize > 0)) {
        return eConverterInternal;
    }
    OutputBuffer output;
    eConverterErrorCode result = GetOutputBuffer(output);
    if (output.m_data == nullptr) {
        return result;
    }

    // The data is the held remainder followed by the new bytes; the remainder's buffer is
    // taken over so that it can be read while a new remainder is kept in it.
    std::unique_ptr<unsigned char[]> held = std::move(m_pRemainder);
    const uint64_t heldSize = held != nullptr ? m_remainderSize : 0;
    m_remainderSize = 0;
    const auto* fresh = static_cast<const unsigned char*>(pcm);
    const uint64_t total = heldSize + pcmSize;

    uint64_t offset = 0;
    while (offset < total) {
        const uint64_t left = total - offset;
        if (m_droppedBytes < m_dropBytes) {
            const uint64_t dropped = std::min(left, m_dropBytes - m_droppedBytes);
            m_droppedBytes += dropped;
            offset += dropped;
            continue;
        }
        if (left < m_blockBytes) {
            if (held == nullptr) {
                held = AllocateBytes(m_blockBytes);
                if (held == nullptr) {
                    return static_cast<eConverterErrorCode>(eTqovixErrorOutOfMemory);
                }
            }
            if (offset < heldSize) {
                std::memmove(held.get(), held.get() + offset, heldSize - offset);
                std::memcpy(held.get() + (heldSize - offset), fresh, pcmSize);
            } else {
                std::memcpy(held.get(), fresh + (offset - heldSize), left);
            }
            m_pRemainder = std::move(held);
            m_remainderSize = static_cast<unsigned int>(left);
            break;
        }
        const unsigned char* block = nullptr;
        if (offset >= heldSize) {
            block = fresh + (offset - heldSize);
        } else {
            // Only a block that starts in the remainder is copied.
            const uint64_t fromHeld = heldSize - offset;
            std::memcpy(m_straddling.get(), held.get() + offset, fromHeld);
            std::memcpy(m_straddling.get() + fromHeld, fresh, m_blockBytes - fromHeld);
            block = m_straddling.get();
        }
        result = EncodeBlock(output, block, m_blockBytes);
        if (TqovixFailed(result)) {
            break;
        }
        offset += m_blockBytes;
    }
    return result;
}

eConverterErrorCode AACEncoder::EncodeDone()
{
    if (m_pStream == nullptr || m_blockBytes == 0) {
        return eConverterInternal;
    }
    OutputBuffer output;
    eConverterErrorCode result = GetOutputBuffer(output);
    if (output.m_data == nullptr) {
        return result;
    }

    // What is held, then one block of silence.
    std::unique_ptr<unsigned char[]> tail = AllocateBytes(2 * m_blockBytes);
    if (tail == nullptr) {
        return static_cast<eConverterErrorCode>(eTqovixErrorOutOfMemory);
    }
    std::memset(tail.get(), 0, 2 * m_blockBytes);
    const unsigned int heldSize = HeldSize();
    if (heldSize > 0) {
        std::memcpy(tail.get(), m_pRemainder.get(), heldSize);
    }
    const unsigned int tailSize = heldSize + m_blockBytes;
    for (unsigned int offset = 0; offset < tailSize;) {
        const unsigned int count = std::min(tailSize - offset, m_blockBytes);
        result = EncodeBlock(output, tail.get() + offset, count);
        if (TqovixFailed(result)) {
            break;
        }
        offset += count;
    }
    m_pRemainder.reset();
    m_remainderSize = 0;
    return result;
}

eConverterErrorCode AACEncoder::Encode(void* aac, unsigned int* aacSize, unsigned int* usedSize, const void* pcm,
                                       unsigned int pcmSize)
{
    if (aac == nullptr || aacSize == nullptr || usedSize == nullptr || pcm == nullptr || pcmSize == 0) {
        return eConverterInternal;
    }
    AudioStreamPacketDescription packetDescription{};
    AudioStreamPacketDescription* descriptions = m_outputDescription.mBytesPerPacket == 0 ? &packetDescription
                                                                                          : nullptr;
    EncoderInput input{pcm, pcmSize, m_outputDescription, AudioStreamPacketDescription{0, 0, pcmSize}};

    AudioBufferList output{};
    output.mNumberBuffers = 1;
    output.mBuffers[0].mNumberChannels = m_inputDescription.mChannelsPerFrame;
    output.mBuffers[0].mDataByteSize = kBlockSize;
    output.mBuffers[0].mData = aac;
    UInt32 packets = 1;
    const eConverterErrorCode result = ConvertACError(
        AudioConverterFillComplexBuffer(m_converter, EncoderDataProc, &input, &packets, &output, descriptions));
    *aacSize = result == eConverterSuccess ? output.mBuffers[0].mDataByteSize : 0;
    *usedSize = pcmSize;
    return result;
}

OSStatus AACEncoder::EncoderDataProc(AudioConverterRef /*converter*/, UInt32* /*ioNumberDataPackets*/,
                                     AudioBufferList* ioData, AudioStreamPacketDescription** outPacketDescription,
                                     void* userData)
{
    auto* input = static_cast<EncoderInput*>(userData);
    ioData->mBuffers[0].mData = const_cast<void*>(input->pcm);
    ioData->mBuffers[0].mDataByteSize = input->pcmSize;
    ioData->mBuffers[0].mNumberChannels = input->description.mChannelsPerFrame;
    if (outPacketDescription != nullptr) {
        *outPacketDescription = nullptr;
    }
    return noErr;
}

#include "codec/AACDecoder.h"

#include <cstring>
#include <new>
#include <vector>

#include "atom/CTqovixAtomControl.h"
#include "file/CTqovixFile.h"
#include "visitor/CTqovixAudioInformationVisitor.h"

namespace {

// The priming of the platform encoder, which the default delay of one packet matches.
constexpr uint32_t kPlatformPrimingFrames = 2112;
constexpr UInt32 kFramesWanted = 1024;

// What DecoderDataProc offers, again on every call.
struct DecoderInput {
    const void* packet;
    unsigned int packetSize;
    AudioStreamBasicDescription description;
    AudioStreamPacketDescription packetDescription;
};

}  // namespace

AACDecoder::AACDecoder() : m_decodedPackets(0), m_decoderDelay(1)
{
}

AACDecoder::~AACDecoder() = default;

eConverterErrorCode AACDecoder::Initialize(const ACFormat& input, const ACFormat& output)
{
    m_decodedPackets = 0;
    m_decoderDelay = 1;
    return AudioConverterBase::Initialize(input, output);
}

void AACDecoder::SetDecoderDelay(unsigned int packets)
{
    m_decoderDelay = packets;
}

eConverterErrorCode AACDecoder::SetDecoderDelay(const char* path)
{
    if (path == nullptr) {
        return eConverterInternal;
    }
    // The priming is the media time of the sound track's first edit, read as a job reads it.
    CTqovixFile file;
    eTqovixErrorCode result = path[0] == '\0' ? eTqovixErrorSourceNotFound : file.Open(path, 1);
    CTqovixAtomControl tree;
    if (!TqovixFailed(result)) {
        result = tree.Initialize(file);
    }
    CTqovixAudioInformationVisitor information;
    if (!TqovixFailed(result)) {
        result = tree.Analyze(information);
    }
    if (TqovixFailed(result)) {
        return static_cast<eConverterErrorCode>(result);
    }
    if (information.GetMediaTime() == kPlatformPrimingFrames) {
        m_decoderDelay = 1;
    }
    return eConverterSuccess;
}

eConverterErrorCode AACDecoder::Decode(void* pcm, unsigned int* pcmSize, unsigned int* usedSize, const void* packet,
                                       unsigned int packetSize)
{
    if (pcm == nullptr || pcmSize == nullptr || usedSize == nullptr || packet == nullptr || packetSize == 0) {
        return eConverterInternal;
    }
    DecoderInput input{packet, packetSize, m_outputDescription, AudioStreamPacketDescription{0, 0, packetSize}};

    // Variable-size output needs room for its packet descriptions; PCM has none.
    std::vector<AudioStreamPacketDescription> descriptions;
    if (m_outputDescription.mBytesPerPacket == 0) {
        UInt32 maximum = 0;
        unsigned int size = sizeof maximum;
        if (GetACProperty(kAudioConverterPropertyMaximumOutputPacketSize, &size, &maximum) == eConverterSuccess &&
            maximum > 0) {
            try {
                descriptions.resize(kMaxPcmSize / maximum);
            } catch (const std::bad_alloc&) {
                return static_cast<eConverterErrorCode>(eTqovixErrorOutOfMemory);
            }
        }
    }

    AudioBufferList output{};
    output.mNumberBuffers = 1;
    output.mBuffers[0].mNumberChannels = m_inputDescription.mChannelsPerFrame;
    output.mBuffers[0].mDataByteSize = kMaxPcmSize;
    output.mBuffers[0].mData = pcm;
    UInt32 packets = kFramesWanted;
    const eConverterErrorCode result =
        ConvertACError(AudioConverterFillComplexBuffer(m_converter, DecoderDataProc, &input, &packets, &output,
                                                       descriptions.empty() ? nullptr : descriptions.data()));
    if (result == eConverterSuccess) {
        *pcmSize = m_decodedPackets < m_decoderDelay ? 0 : output.mBuffers[0].mDataByteSize;
        *usedSize = packetSize;
    } else {
        *pcmSize = 0;
        *usedSize = 0;
    }
    ++m_decodedPackets;
    return result;
}

OSStatus AACDecoder::DecoderDataProc(AudioConverterRef /*converter*/, UInt32* /*ioNumberDataPackets*/,
                                     AudioBufferList* ioData, AudioStreamPacketDescription** outPacketDescription,
                                     void* userData)
{
    auto* input = static_cast<DecoderInput*>(userData);
    ioData->mBuffers[0].mData = const_cast<void*>(input->packet);
    ioData->mBuffers[0].mDataByteSize = input->packetSize;
    ioData->mBuffers[0].mNumberChannels = input->description.mChannelsPerFrame;
    if (outPacketDescription != nullptr) {
        *outPacketDescription = &input->packetDescription;
    }
    return noErr;
}

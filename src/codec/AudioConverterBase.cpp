#include "codec/AudioConverterBase.h"

namespace {

constexpr uint32_t kMeaningfulFlags = 0x7F;

}  // namespace

AudioConverterBase::AudioConverterBase() : m_converter(nullptr), m_inputDescription{}, m_outputDescription{}
{
}

AudioConverterBase::~AudioConverterBase()
{
    if (m_converter != nullptr) {
        AudioConverterDispose(m_converter);
    }
}

eConverterErrorCode AudioConverterBase::Initialize(const ACFormat& input, const ACFormat& output)
{
    ACFormat2BasicDescription(input, m_inputDescription);
    ACFormat2BasicDescription(output, m_outputDescription);
    eConverterErrorCode result = CreateConverter(m_inputDescription, m_outputDescription);
    if (result == eConverterSuccess) {
        unsigned int size = sizeof m_inputDescription;
        result = GetACProperty(kAudioConverterCurrentInputStreamDescription, &size, &m_inputDescription);
    }
    if (result == eConverterSuccess) {
        unsigned int size = sizeof m_outputDescription;
        result = GetACProperty(kAudioConverterCurrentOutputStreamDescription, &size, &m_outputDescription);
    }
    if (result != eConverterSuccess) {
        CloseConverter();
    }
    return result;
}

void AudioConverterBase::Close()
{
    CloseConverter();
}

eConverterErrorCode AudioConverterBase::CreateConverter(const AudioStreamBasicDescription& input,
                                                        const AudioStreamBasicDescription& output)
{
    // A converter made earlier would otherwise be lost.
    CloseConverter();
    return ConvertACError(AudioConverterNew(&input, &output, &m_converter));
}

void AudioConverterBase::CloseConverter()
{
    if (m_converter != nullptr) {
        AudioConverterDispose(m_converter);
        m_converter = nullptr;
    }
}

eConverterErrorCode AudioConverterBase::GetACProperty(unsigned int propertyID, unsigned int* propertySize,
                                                      void* propertyData) const
{
    if (m_converter == nullptr) {
        return eConverterInternal;
    }
    return ConvertACError(AudioConverterGetProperty(m_converter, propertyID, propertySize, propertyData));
}

eConverterErrorCode AudioConverterBase::SetACProperty(unsigned int propertyID, unsigned int propertySize,
                                                      void* propertyData)
{
    if (m_converter == nullptr) {
        return eConverterInternal;
    }
    return ConvertACError(AudioConverterSetProperty(m_converter, propertyID, propertySize, propertyData));
}

void AudioConverterBase::ACFormat2BasicDescription(const ACFormat& format,
                                                   AudioStreamBasicDescription& description) const
{
    description.mSampleRate = format.sampleRate;
    if (format.formatID == ACFormatLinearPCM) {
        description.mFormatID = kAudioFormatLinearPCM;
    } else if (format.formatID == ACFormatAAC) {
        description.mFormatID = kAudioFormatMPEG4AAC;
    }
    description.mFormatFlags = format.formatFlags & kMeaningfulFlags;
    description.mBytesPerPacket = format.bytesPerPacket;
    description.mFramesPerPacket = format.framesPerPacket;
    description.mBytesPerFrame = format.bytesPerFrame;
    description.mChannelsPerFrame = format.channelsPerFrame;
    description.mBitsPerChannel = format.bitsPerChannel;
    description.mReserved = 0;
}

void AudioConverterBase::BasicDescription2ACFormat(const AudioStreamBasicDescription& description,
                                                   ACFormat& format) const
{
    format.sampleRate = description.mSampleRate;
    if (description.mFormatID == kAudioFormatLinearPCM) {
        format.formatID = ACFormatLinearPCM;
    } else if (description.mFormatID == kAudioFormatMPEG4AAC) {
        format.formatID = ACFormatAAC;
    }
    format.formatFlags = description.mFormatFlags & kMeaningfulFlags;
    format.bytesPerPacket = description.mBytesPerPacket;
    format.framesPerPacket = description.mFramesPerPacket;
    format.bytesPerFrame = description.mBytesPerFrame;
    format.channelsPerFrame = description.mChannelsPerFrame;
    format.bitsPerChannel = description.mBitsPerChannel;
}

void AudioConverterBase::GetInputFormat(ACFormat& format) const
{
    BasicDescription2ACFormat(m_inputDescription, format);
}

void AudioConverterBase::GetOutputFormat(ACFormat& format) const
{
    BasicDescription2ACFormat(m_outputDescription, format);
}

eConverterErrorCode ConvertACError(int status)
{
    switch (status) {
    case noErr:
        return eConverterSuccess;
    case kAudioConverterErr_FormatNotSupported:
    case kAudioConverterErr_OperationNotSupported:
    case kAudioConverterErr_PropertyNotSupported:
    case kAudioConverterErr_InvalidInputSize:
    case kAudioConverterErr_InvalidOutputSize:
    case kAudioConverterErr_BadPropertySizeError:
    case kAudioConverterErr_RequiresPacketDescriptionsError:
    case kAudioConverterErr_InputSampleRateOutOfRange:
    case kAudioConverterErr_OutputSampleRateOutOfRange:
        return eConverterRefused;
    case kAudioConverterErr_UnspecifiedError:
        return eConverterFailed;
    default:
        return eConverterInternal;
    }
}

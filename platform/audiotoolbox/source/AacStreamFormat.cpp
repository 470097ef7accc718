#include "AacStreamFormat.h"

#include <AudioToolbox/AudioConverter.h>

#include <array>
#include <cmath>

namespace atcompat {

namespace {

constexpr std::array<int, 13> kAacRates = {96000, 88200, 64000, 48000, 44100, 32000, 24000,
                                           22050, 16000, 12000, 11025, 8000,  7350};

constexpr UInt32 kPcmBytesPerSample = 2;

bool IsPcm16Interleaved(const AudioStreamBasicDescription& pcm)
{
    const AudioFormatFlags flags = pcm.mFormatFlags;
    if (pcm.mFormatID != kAudioFormatLinearPCM || (flags & kAudioFormatFlagIsFloat) != 0 ||
        (flags & kAudioFormatFlagIsSignedInteger) == 0 || (flags & kAudioFormatFlagIsNonInterleaved) != 0 ||
        (flags & kAudioFormatFlagIsBigEndian) != kAudioFormatFlagsNativeEndian) {
        return false;
    }
    return pcm.mBitsPerChannel == 8 * kPcmBytesPerSample && pcm.mFramesPerPacket == 1 &&
           pcm.mChannelsPerFrame > 0 && pcm.mBytesPerFrame == kPcmBytesPerSample * pcm.mChannelsPerFrame &&
           pcm.mBytesPerPacket == pcm.mBytesPerFrame;
}

bool IsAacLc(const AudioStreamBasicDescription& aac)
{
    // The flags of an AAC description name the object type; 0 leaves it to the default.
    return aac.mFormatID == kAudioFormatMPEG4AAC &&
           (aac.mFormatFlags == 0 || aac.mFormatFlags == kMPEG4Object_AAC_LC) &&
           (aac.mFramesPerPacket == 0 || aac.mFramesPerPacket == kAacFramesPerPacket) && aac.mBytesPerPacket == 0 &&
           aac.mBytesPerFrame == 0;
}

int RateIndex(int aacRate)
{
    for (size_t i = 0; i < kAacRates.size(); ++i) {
        if (kAacRates[i] == aacRate) {
            return static_cast<int>(i);
        }
    }
    return -1;
}

// An MPEG-4 descriptor header: tag, then a length of up to four 7-bit groups.
bool ReadDescriptor(const uint8_t* data, size_t size, size_t* position, uint8_t* tag, size_t* length)
{
    if (*position >= size) {
        return false;
    }
    *tag = data[(*position)++];
    size_t value = 0;
    for (int i = 0; i < 4; ++i) {
        if (*position >= size) {
            return false;
        }
        const uint8_t byte = data[(*position)++];
        value = (value << 7) | (byte & 0x7F);
        if ((byte & 0x80) == 0) {
            *length = value;
            return value <= size - *position;
        }
    }
    return false;
}

std::vector<uint8_t> ConfigFromEsDescriptor(const uint8_t* data, size_t size)
{
    constexpr uint8_t kEsTag = 0x03;
    constexpr uint8_t kDecoderConfigTag = 0x04;
    constexpr uint8_t kDecoderSpecificTag = 0x05;
    constexpr size_t kDecoderConfigFixedSize = 13;

    size_t position = 0;
    uint8_t tag = 0;
    size_t length = 0;
    if (!ReadDescriptor(data, size, &position, &tag, &length) || tag != kEsTag || length < 3) {
        return {};
    }
    const size_t esEnd = position + length;
    const uint8_t flags = data[position + 2];
    position += 3;
    if ((flags & 0x80) != 0) {  // depends on another stream
        position += 2;
    }
    if ((flags & 0x40) != 0) {  // URL
        if (position >= esEnd) {
            return {};
        }
        position += 1 + size_t{data[position]};
    }
    if ((flags & 0x20) != 0) {  // OCR stream
        position += 2;
    }
    if (position > esEnd || !ReadDescriptor(data, esEnd, &position, &tag, &length) || tag != kDecoderConfigTag ||
        length < kDecoderConfigFixedSize) {
        return {};
    }
    const size_t configEnd = position + length;
    position += kDecoderConfigFixedSize;
    while (position < configEnd) {
        if (!ReadDescriptor(data, configEnd, &position, &tag, &length)) {
            return {};
        }
        if (tag == kDecoderSpecificTag) {
            return std::vector<uint8_t>(data + position, data + position + length);
        }
        position += length;
    }
    return {};
}

}  // namespace

int AacSampleRateFor(Float64 rate)
{
    if (!std::isfinite(rate) || rate <= 0) {
        return 0;
    }
    for (int aacRate : kAacRates) {
        const double kiloLabel = std::round(aacRate / 1000.0) * 1000.0;
        if (rate == aacRate || rate == kiloLabel) {
            return aacRate;
        }
    }
    return 0;
}

OSStatus CheckAacPcmPair(const AudioStreamBasicDescription& aac, const AudioStreamBasicDescription& pcm,
                         bool encoding, int* aacRate)
{
    if (!IsAacLc(aac) || !IsPcm16Interleaved(pcm) || aac.mChannelsPerFrame != pcm.mChannelsPerFrame ||
        aac.mChannelsPerFrame == 0 || aac.mChannelsPerFrame > kAacMaxChannels) {
        return kAudioConverterErr_FormatNotSupported;
    }
    const OSStatus aacSideRange = encoding ? kAudioConverterErr_OutputSampleRateOutOfRange
                                           : kAudioConverterErr_InputSampleRateOutOfRange;
    const OSStatus pcmSideRange = encoding ? kAudioConverterErr_InputSampleRateOutOfRange
                                           : kAudioConverterErr_OutputSampleRateOutOfRange;
    const int rate = AacSampleRateFor(aac.mSampleRate);
    if (rate == 0) {
        return aacSideRange;
    }
    // No resampling: both sides must name the same rate, if perhaps with different labels.
    if (AacSampleRateFor(pcm.mSampleRate) != rate) {
        return pcmSideRange;
    }
    *aacRate = rate;
    return noErr;
}

AudioStreamBasicDescription CompletedAacDescription(const AudioStreamBasicDescription& aac)
{
    AudioStreamBasicDescription completed = aac;
    completed.mFramesPerPacket = kAacFramesPerPacket;
    completed.mBitsPerChannel = 0;
    completed.mReserved = 0;
    return completed;
}

AudioStreamBasicDescription CompletedPcmDescription(const AudioStreamBasicDescription& pcm)
{
    AudioStreamBasicDescription completed = pcm;
    completed.mFormatFlags |= kAudioFormatFlagIsPacked;
    completed.mReserved = 0;
    return completed;
}

std::vector<uint8_t> MakeAudioSpecificConfig(int aacRate, UInt32 channels)
{
    const int index = RateIndex(aacRate);
    if (index < 0 || channels == 0 || channels > kAacMaxChannels) {
        return {};
    }
    // object type (5 bits), rate index (4), channel configuration (4), three zero flags
    const unsigned bits = (unsigned{kMPEG4Object_AAC_LC} << 11) | (static_cast<unsigned>(index) << 7) |
                          (channels << 3);
    return {static_cast<uint8_t>(bits >> 8), static_cast<uint8_t>(bits & 0xFF)};
}

std::vector<uint8_t> AudioSpecificConfigFromCookie(const uint8_t* cookie, size_t size)
{
    constexpr uint8_t kEsTag = 0x03;
    if (cookie == nullptr || size == 0) {
        return {};
    }
    if (cookie[0] == kEsTag) {
        return ConfigFromEsDescriptor(cookie, size);
    }
    if (size > 4 && cookie[0] == 0 && cookie[1] == 0 && cookie[2] == 0 && cookie[3] == 0 && cookie[4] == kEsTag) {
        return ConfigFromEsDescriptor(cookie + 4, size - 4);
    }
    // An AudioSpecificConfig never starts with object type 0, so no ES descriptor is mistaken for one.
    if ((cookie[0] >> 3) == 0) {
        return {};
    }
    return std::vector<uint8_t>(cookie, cookie + size);
}

}  // namespace atcompat

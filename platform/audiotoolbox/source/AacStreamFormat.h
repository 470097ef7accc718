// What the converters accept: the AAC and PCM stream descriptions they pair, the
// AAC sampling rates, and the decoder configuration (AudioSpecificConfig).
#pragma once

#include <CoreAudioTypes/CoreAudioTypes.h>

#include <cstddef>
#include <cstdint>
#include <vector>

namespace atcompat {

inline constexpr UInt32 kAacFramesPerPacket = 1024;
// A raw AAC packet carries at most 6144 bits per channel.
inline constexpr UInt32 kAacMaxPacketBytesPerChannel = 768;
// Some writers' encoders (ffmpeg's among them) overshoot that bound now and then; what
// they wrote still decodes, so the decoder takes packets up to four times as large.
inline constexpr UInt32 kAacMaxDecodablePacketBytesPerChannel = 4 * kAacMaxPacketBytesPerChannel;
// Channel configurations 1 to 6; 7 and 8 channels have no unambiguous channel order.
inline constexpr UInt32 kAacMaxChannels = 6;

// The AAC sampling rate that `rate` stands for: the rate itself, or the one it labels
// in whole kilohertz (44000 for 44100, 22000 for 22050). 0 when there is none.
int AacSampleRateFor(Float64 rate);

// The stream pair one converter joins, checked: `aac` and `pcm` are the AAC and PCM
// sides whichever way the converter runs. On success `*aacRate` is the AAC rate.
OSStatus CheckAacPcmPair(const AudioStreamBasicDescription& aac, const AudioStreamBasicDescription& pcm,
                         bool encoding, int* aacRate);

// The descriptions a converter reports: the caller's, with the fields it left open filled in.
AudioStreamBasicDescription CompletedAacDescription(const AudioStreamBasicDescription& aac);
AudioStreamBasicDescription CompletedPcmDescription(const AudioStreamBasicDescription& pcm);

// AAC-LC AudioSpecificConfig for a rate from the AAC table and 1 to 6 channels.
std::vector<uint8_t> MakeAudioSpecificConfig(int aacRate, UInt32 channels);

// A decompression cookie is either an AudioSpecificConfig or an MPEG-4 ES descriptor
// (optionally behind the four version and flag bytes of its "esds" atom) that carries
// one. Empty when the cookie is neither.
std::vector<uint8_t> AudioSpecificConfigFromCookie(const uint8_t* cookie, size_t size);

}  // namespace atcompat

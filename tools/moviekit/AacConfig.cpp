#include "AacConfig.h"

#include "Pattern.h"

#include <array>

namespace moviekit {

namespace {

class BitWriter {
public:
    void Put(uint32_t value, unsigned bits)
    {
        for (unsigned i = bits; i-- > 0;) {
            m_current = static_cast<uint8_t>((m_current << 1) | ((value >> i) & 1U));
            if (++m_used == 8) {
                m_bytes.push_back(m_current);
                m_current = 0;
                m_used = 0;
            }
        }
    }
    Bytes Finish()
    {
        if (m_used != 0) {
            m_bytes.push_back(static_cast<uint8_t>(m_current << (8 - m_used)));
            m_current = 0;
            m_used = 0;
        }
        return std::move(m_bytes);
    }

private:
    Bytes m_bytes;
    uint8_t m_current = 0;
    unsigned m_used = 0;
};

void PutDescriptorSize(Bytes& out, size_t size, bool longForm)
{
    if (longForm && size < 0x80) {
        PutU8(out, 0x80);
        PutU8(out, 0x80);
        PutU8(out, 0x80);
        PutU8(out, static_cast<uint8_t>(size));
        return;
    }
    // Bodies beyond 127 bytes need the general multi-byte form whatever was asked.
    if (size >= 0x80) {
        for (int shift = 21; shift > 0; shift -= 7) {
            PutU8(out, static_cast<uint8_t>(0x80 | ((size >> shift) & 0x7F)));
        }
    }
    PutU8(out, static_cast<uint8_t>(size & 0x7F));
}

Bytes Descriptor(uint8_t tag, const Bytes& body, bool longForm)
{
    Bytes out;
    PutU8(out, tag);
    PutDescriptorSize(out, body.size(), longForm);
    PutBytes(out, body);
    return out;
}

// An individual_channel_stream with one long window and max_sfb 0: nothing to decode.
void PutEmptyChannelStream(BitWriter& bits)
{
    bits.Put(100, 8);  // global_gain
    bits.Put(0, 1);    // ics_reserved_bit
    bits.Put(0, 2);    // ONLY_LONG_SEQUENCE
    bits.Put(0, 1);    // window_shape
    bits.Put(0, 6);    // max_sfb
    bits.Put(0, 1);    // predictor_data_present
    bits.Put(0, 3);    // pulse, tns, gain control absent
}

}  // namespace

Bytes MakeAudioSpecificConfig(uint32_t sampleRate, uint16_t channels, uint8_t objectType)
{
    static constexpr std::array<uint32_t, 13> kRates = {96000, 88200, 64000, 48000, 44100, 32000, 24000,
                                                        22050, 16000, 12000, 11025, 8000,  7350};
    BitWriter bits;
    bits.Put(objectType, 5);
    uint32_t index = 15;
    for (uint32_t i = 0; i < kRates.size(); ++i) {
        if (kRates[i] == sampleRate) {
            index = i;
        }
    }
    bits.Put(index, 4);
    if (index == 15) {
        bits.Put(sampleRate, 24);
    }
    bits.Put(channels, 4);
    bits.Put(0, 3);  // frameLengthFlag, dependsOnCoreCoder, extensionFlag
    return bits.Finish();
}

Bytes MakeEsdsPayload(const EsdsRecipe& recipe, const Bytes& audioSpecificConfig, uint32_t maxBitRate,
                      uint32_t averageBitRate)
{
    if (recipe.rawPayload) {
        return *recipe.rawPayload;
    }
    Bytes config;
    PutU8(config, recipe.objectType);
    PutU8(config, recipe.streamType);
    PutU24(config, recipe.bufferSize);
    PutU32(config, maxBitRate);
    PutU32(config, averageBitRate);
    PutBytes(config, Descriptor(0x05, audioSpecificConfig, recipe.longSizes));
    if (recipe.profileLevelAfterConfig) {
        PutBytes(config, Descriptor(0x14, Bytes{0x01}, recipe.longSizes));
    }

    Bytes es;
    PutU16(es, 1);  // ES_ID
    PutU8(es, recipe.esFlags);
    if (recipe.esFlags & 0x80) {
        PutU16(es, 0);
    }
    if (recipe.esFlags & 0x40) {
        PutU8(es, 0);  // empty URL
    }
    if (recipe.esFlags & 0x20) {
        PutU16(es, 0);
    }
    PutBytes(es, Descriptor(0x04, config, recipe.longSizes));
    PutBytes(es, Descriptor(0x06, Bytes{0x02}, recipe.longSizes));  // SLConfig: predefined MP4

    Bytes payload;
    PutU32(payload, 0);  // version and flags
    PutBytes(payload, Descriptor(0x03, es, recipe.longSizes));
    return payload;
}

Bytes MakeSilentAacPacket(uint16_t channels, uint32_t fillBytes, uint64_t seed)
{
    BitWriter bits;
    if (channels == 1) {
        bits.Put(0, 3);  // ID_SCE
        bits.Put(0, 4);
        PutEmptyChannelStream(bits);
    } else {
        bits.Put(1, 3);  // ID_CPE
        bits.Put(0, 4);
        bits.Put(0, 1);  // no common window
        PutEmptyChannelStream(bits);
        PutEmptyChannelStream(bits);
    }
    if (fillBytes > kMaxAacFillBytes) {
        fillBytes = kMaxAacFillBytes;
    }
    if (fillBytes > 0) {
        bits.Put(6, 3);  // ID_FIL
        if (fillBytes < 15) {
            bits.Put(fillBytes, 4);
        } else {
            bits.Put(15, 4);
            bits.Put(fillBytes - 14, 8);
        }
        // The first byte says EXT_FILL, so a decoder skips the rest unread.
        bits.Put(0, 8);
        uint64_t state = SplitMix64(seed);
        for (uint32_t i = 1; i < fillBytes; ++i) {
            state = SplitMix64(state);
            bits.Put(static_cast<uint32_t>(state & 0xFF), 8);
        }
    }
    bits.Put(7, 3);  // ID_END
    return bits.Finish();
}

uint32_t SilentAacPacketSize(uint16_t channels, uint32_t fillBytes)
{
    if (fillBytes > kMaxAacFillBytes) {
        fillBytes = kMaxAacFillBytes;
    }
    uint32_t bitCount = channels == 1 ? 29 : 52;
    if (fillBytes > 0) {
        bitCount += (fillBytes < 15 ? 7 : 15) + 8 * fillBytes;
    }
    bitCount += 3;
    return (bitCount + 7) / 8;
}

}  // namespace moviekit

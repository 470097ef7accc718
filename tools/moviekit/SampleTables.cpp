#include "SampleTables.h"

#include <algorithm>
#include <cstring>

namespace moviekit {

Bytes Stts(uint32_t count, uint32_t duration)
{
    Bytes p;
    PutU32(p, 0);
    PutU32(p, 1);
    PutU32(p, count);
    PutU32(p, duration);
    return Atom("stts", p);
}

Bytes Stsc(const std::vector<ChunkLayout>& chunks)
{
    Bytes entries;
    uint32_t entryCount = 0;
    uint32_t previous = 0;
    for (size_t i = 0; i < chunks.size(); ++i) {
        if (i == 0 || chunks[i].sampleCount != previous) {
            PutU32(entries, static_cast<uint32_t>(i + 1));
            PutU32(entries, chunks[i].sampleCount);
            PutU32(entries, 1);
            previous = chunks[i].sampleCount;
            ++entryCount;
        }
    }
    Bytes p;
    PutU32(p, 0);
    PutU32(p, entryCount);
    PutBytes(p, entries);
    return Atom("stsc", p);
}

Bytes Stsz(const std::vector<ChunkLayout>& chunks, uint32_t commonSize, uint64_t sampleCount)
{
    Bytes p;
    PutU32(p, 0);
    PutU32(p, commonSize);
    PutU32(p, static_cast<uint32_t>(std::min<uint64_t>(sampleCount, UINT32_MAX)));
    if (commonSize == 0) {
        for (const ChunkLayout& chunk : chunks) {
            for (uint32_t size : chunk.sampleSizes) {
                PutU32(p, size);
            }
        }
    }
    return Atom("stsz", p);
}

Bytes ChunkOffsets(const std::vector<ChunkLayout>& chunks, bool co64)
{
    Bytes p;
    PutU32(p, 0);
    PutU32(p, static_cast<uint32_t>(chunks.size()));
    for (const ChunkLayout& chunk : chunks) {
        if (co64) {
            PutU64(p, chunk.offset);
        } else {
            PutU32(p, static_cast<uint32_t>(chunk.offset));
        }
    }
    return Atom(co64 ? "co64" : "stco", p);
}

Bytes VideoDescription(const VideoRecipe& video)
{
    Bytes e;
    e.insert(e.end(), 6, 0);
    PutU16(e, 1);  // data reference index
    PutU16(e, 0);  // version
    PutU16(e, 0);  // revision
    PutU32(e, 0);  // vendor
    PutU32(e, 0);  // temporal quality
    PutU32(e, 512);  // spatial quality
    PutU16(e, video.width);
    PutU16(e, video.height);
    PutU32(e, 72U << 16);
    PutU32(e, 72U << 16);
    PutU32(e, 0);  // data size
    PutU16(e, 1);  // frames per sample
    e.insert(e.end(), 32, 0);  // compressor name
    PutU16(e, 24);
    PutU16(e, 0xFFFF);  // no color table
    Bytes p;
    PutU32(p, 0);
    PutU32(p, 1);
    PutBytes(p, Atom(video.format, e));
    return Atom("stsd", p);
}

Bytes SoundDescription(const SoundRecipe& sound, const MoviePlan& plan)
{
    // Deeper samples need the frame's size, which version 1 gives; rates past 16.16, version 2.
    const uint16_t version = plan.version2Lpcm ? 2 : plan.deepPcm ? 1 : sound.descriptionVersion;
    Bytes e;
    e.insert(e.end(), 6, 0);
    PutU16(e, 1);
    PutU16(e, version);
    PutU16(e, 0);  // revision
    PutU32(e, 0);  // vendor
    if (plan.version2Lpcm) {
        PutU16(e, 3);
        PutU16(e, 16);
        PutU16(e, 0xFFFE);
        PutU16(e, 0);
        PutU32(e, 0x10000);
        PutU32(e, 72);  // the fields' size
        double rate = sound.sampleRate;
        uint64_t rateBits = 0;
        std::memcpy(&rateBits, &rate, sizeof rateBits);
        PutU32(e, static_cast<uint32_t>(rateBits >> 32));
        PutU32(e, static_cast<uint32_t>(rateBits));
        PutU32(e, sound.channels);
        PutU32(e, 0x7F000000);
        PutU32(e, sound.bits);
        // Float or signed integer, big-endian unless little, packed.
        PutU32(e, (sound.floatingPoint ? 1U : 4U) | (plan.littleEndianPcm ? 0U : 2U) | 8U);
        PutU32(e, plan.bytesPerFrame);  // bytes per packet of one frame
        PutU32(e, 1);
    } else {
        PutU16(e, sound.channels);
        PutU16(e, 16);
        PutU16(e, version == 1 && plan.aac ? 0xFFFE : 0);  // compression ID
        PutU16(e, 0);  // packet size
        PutU32(e, uint32_t{sound.sampleRate} << 16);
    }
    if (version == 1) {
        PutU32(e, plan.aac ? kAacFramesPerPacket : 1);  // frames per packet
        PutU32(e, plan.aac ? 0 : plan.sampleBytes);     // bytes per packet, one channel
        PutU32(e, plan.aac ? 0 : plan.bytesPerFrame);
        PutU32(e, 2);  // bytes per sample, as QuickTime keeps it
    }
    if (plan.aac) {
        PutBytes(e, Atom("esds", plan.esdsPayload));
    } else if (plan.deepPcm && !plan.version2Lpcm && plan.littleEndianPcm) {
        PutBytes(e, Container("wave", {Atom("frma", Bytes(plan.soundFormat.begin(), plan.soundFormat.end())),
                                       Atom("enda", Bytes{0, 1}), Bytes(8, 0)}));
    }
    Bytes p;
    PutU32(p, 0);
    PutU32(p, 1);
    PutBytes(p, Atom(plan.soundFormat, e));
    return Atom("stsd", p);
}

}  // namespace moviekit

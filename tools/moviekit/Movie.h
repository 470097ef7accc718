// Camera-style QuickTime movies for tests, benchmarks and the demo: a description with
// camera defaults, and a writer that streams it to a file (memory grows with "moov" only).
#pragma once

#include "AacConfig.h"
#include "ByteWriter.h"
#include "MakerData.h"

#include <cstdint>
#include <optional>
#include <string>
#include <vector>

namespace moviekit {

struct VideoRecipe {
    bool present = true;
    std::string format = "raw ";  // any other four-cc gets the same pattern bytes
    uint16_t width = 64;
    uint16_t height = 36;
    uint32_t timeScale = 30000;
    uint32_t frameDuration = 1001;
    uint32_t frameCount = 30;
    uint32_t framesPerChunk = 15;
    uint32_t frameSize = 0;  // 0: width × height × 3, what a 24-bit "raw " frame holds
    bool perSampleSizes = false;  // "stsz" lists every frame instead of one common size
    bool edit = true;
};

enum class SoundCodec { Twos, Sowt, Aac };

struct SoundRecipe {
    bool present = true;
    SoundCodec codec = SoundCodec::Twos;
    std::string formatOverride;  // another four-cc for big-endian PCM, e.g. "lpcm"
    // Rates past 65535 Hz do not fit the 16.16 field: they make a version-2 "lpcm" description.
    uint32_t sampleRate = 48000;
    uint16_t channels = 2;
    // PCM: 16, 24 or 32-bit integers, or with floatingPoint 32 or 64-bit floats. Deeper than 16
    // bits is "in24", "in32", "fl32" or "fl64" in a version-1 description, whose "wave" holds
    // an "enda" for little-endian samples (Sowt); or "lpcm" with version2Lpcm.
    uint16_t bits = 16;
    bool floatingPoint = false;
    bool version2Lpcm = false;
    // 0 or 1 as cameras write; any other value is written into a version-0 layout.
    uint16_t descriptionVersion = 0;
    // Sound samples: PCM frames or AAC packets. 0: as long as the video (one second without).
    uint64_t sampleCount = 0;
    // Samples per chunk; 0: one chunk per video chunk period. The last chunk takes the rest.
    uint32_t samplesPerChunk = 0;
    std::vector<uint32_t> chunkSampleCounts;  // explicit chunks; overrides samplesPerChunk
    std::vector<int16_t> pcm;  // interleaved; empty: a deterministic tone (with low bits when deeper)
    std::vector<int32_t> widePcm;  // interleaved, full scale at 2^31, for deeper samples; wins over pcm
    uint32_t toneHz = 1000;
    std::vector<Bytes> aacPackets;  // empty: silent packets of varying size
    EsdsRecipe esds;
    bool edts = true;
    bool elst = true;
    // Unset: the priming a camera records (1024 for AAC, 0 for PCM).
    std::optional<uint32_t> mediaTime;
};

struct MakerRecipe {
    bool userData = true;
    bool afInformation = true;
    std::optional<Bytes> afPayload;  // unset: "AFR1" from the fields below
    std::optional<std::vector<AfInterval>> afIntervals;  // unset: two intervals inside the sound
    bool afProcessed = false;
    bool audioLevel = true;
    std::optional<Bytes> audioLevelPayload;  // unset: "ALV1" with levelDb100
    int32_t levelDb100 = -1200;
    bool tagAtom = true;
    std::optional<Bytes> tagPayload;  // raw "TCTG" payload; wins over `tags`
    // Unset: software name, then trim tags with the fields below and the video's frame rate.
    std::optional<std::vector<Tag>> tags;
    std::string softwareName = "Camera Firmware 1.00";
    uint32_t removedFrameForward = 0;
    uint32_t removedFrameBackward = 0;
    std::vector<Bytes> extraUdtaChildren;  // serialised atoms appended in "udta"
    std::vector<Bytes> extraTcdtChildren;
    std::vector<Bytes> extraTcdbChildren;
};

struct MovieRecipe {
    std::string majorBrand = "qt  ";
    uint32_t minorVersion = 0x00000200;
    std::vector<std::string> compatibleBrands = {"qt  "};
    bool wide = true;         // 8-byte "wide" just before the first "mdat"
    uint32_t freeSize = 0;    // a "free" atom of this many payload bytes after "ftyp"; 0: none
    uint32_t mdatCount = 1;   // chunks are shared out over this many consecutive "mdat"
    bool largeMdatHeader = false;  // size field 1 and a 64-bit size (forced past 4 GiB)
    bool moovBeforeMdat = false;
    bool ftypAfterMoov = false;
    bool soundTrackFirst = false;
    bool soundFirstInPeriod = false;  // within a video chunk period, sound chunks lead
    bool co64 = false;                // forced when an offset needs it
    bool dataHandlerInMinf = true;    // QuickTime's "dhlr" handler inside "minf"
    uint32_t movieTimeScale = 1000;
    Bytes trailingBytes;  // appended after the last atom, for size accounting tests
    bool keepSoundBytes = true;  // MovieLayout::soundBytes; off for very large movies
    VideoRecipe video;
    SoundRecipe sound;
    MakerRecipe maker;
};

struct ChunkLayout {
    uint64_t offset = 0;  // in the file
    uint64_t size = 0;
    uint64_t firstSample = 0;  // track sample number, from 0
    uint32_t sampleCount = 0;
    std::vector<uint32_t> sampleSizes;  // AAC packets, or video frames with per-sample sizes
};

struct MovieLayout {
    std::vector<ChunkLayout> soundChunks;
    std::vector<ChunkLayout> videoChunks;
    Bytes soundBytes;  // every sound chunk as stored, in track order
    std::vector<uint64_t> mdatOffsets;  // atom starts
    std::vector<uint64_t> mdatPayloadOffsets;
    std::vector<uint64_t> mdatPayloadSizes;
    uint64_t moovOffset = 0;
    uint64_t moovSize = 0;
    uint64_t fileSize = 0;
    bool co64 = false;
    uint64_t soundSampleCount = 0;  // PCM frames or AAC packets
    uint32_t videoFrameSize = 0;
};

bool WriteMovie(const std::string& path, const MovieRecipe& recipe, MovieLayout* layout, std::string* error);
// Same bytes as WriteMovie; empty on an invalid description (the reason in `error`).
Bytes BuildMovie(const MovieRecipe& recipe, MovieLayout* layout = nullptr, std::string* error = nullptr);

}  // namespace moviekit

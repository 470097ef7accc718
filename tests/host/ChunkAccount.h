// A walker written for the tests alone, independent of the library's parser: it
// reads every track's sample tables and checks that each byte of the media data
// belongs to exactly one chunk of one track, and that no chunk lies outside it.
#pragma once

#include <cstdint>
#include <string>
#include <vector>

namespace jobtest {

struct TrackChunks {
    std::string handler;  // "soun", "vide", "tmcd", ...
    std::string format;
    std::vector<std::pair<uint64_t, uint64_t>> chunks;  // offset, size
    std::vector<std::pair<uint64_t, uint64_t>> samples;  // offset, size; only where each has its own size
};

// Every track whose media lies in the file, in "trak" order; false with a reason when
// the tables cannot be read.
bool ReadTrackChunks(const std::string& path, std::vector<TrackChunks>& tracks, std::string* reason);

// The first sound track's samples (AAC packets) as the file holds them, each as its bytes;
// empty when the tables cannot be read or give no size per sample.
std::vector<std::vector<uint8_t>> SoundPackets(const std::string& path);

// Empty when the media data atoms hold the chunks of every track and nothing else,
// each chunk once; otherwise what is wrong.
std::string AccountForEveryByte(const std::string& path);

}  // namespace jobtest

// What the host-side suites share: an initialised library per test, movies written by
// moviekit into a scratch directory, jobs run to their end with a bounded wait, and
// ffprobe/ffmpeg as the independent readers of what a job wrote.
#pragma once

#include <gtest/gtest.h>

#include <chrono>
#include <cstdint>
#include <string>
#include <vector>

#include "Movie.h"
#include "api/TqOVIXUtility.h"
#include "support/ProcessedRegions.h"
#include "support/TestSupport.h"

namespace jobtest {

inline constexpr auto kJobPatience = std::chrono::seconds(120);

// Polls TqIsFinishedOVIX until it stops answering 0; -1 when the patience runs out.
int WaitForJob(std::chrono::steady_clock::duration patience = kJobPatience);

struct FileStamp {
    std::vector<uint8_t> bytes;
    int64_t modifiedNs = 0;
    bool operator==(const FileStamp&) const = default;
};
FileStamp StampFile(const std::string& path);
bool Exists(const std::string& path);

// One line per packet of the stream: "size,hash" from ffmpeg's framemd5 of a stream copy.
std::vector<std::string> PacketHashes(const std::string& path, const std::string& stream);
// The same for the stream's first `count` packets only.
std::vector<std::string> FirstPacketHashes(const std::string& path, const std::string& stream, uint64_t count);
// ffprobe's verdict: empty when it reads every packet without complaint, else its messages.
std::string ProbeErrors(const std::string& path);
// Packets of one stream as ffprobe counts them.
uint64_t PacketCount(const std::string& path, const std::string& stream);
// Decodes the first sound stream to interleaved s16; false when ffmpeg reports an error.
bool DecodeSound(const std::string& path, std::vector<int16_t>& samples);
// The same as doubles, which hold every sample of 16, 24 and 32-bit integers and of floats exactly
// (integers scaled to ±1 by a power of two).
bool DecodeSound(const std::string& path, std::vector<double>& samples);

// Re-encoded sound against the source's decode, both from ffmpeg, channel by channel and frame
// for frame (no lag allowed): outside the spans widened by `margin` (where coding smears an edge),
// apart from the first and last `leadIn` frames (the encoder's start and flush), every whole block
// of 1024 frames at least `keptDb` of signal over difference; inside each span shrunk by `margin`,
// at most `changedDb`. Empty when that holds, else what does not.
std::string CheckReencodedSound(const std::vector<int16_t>& source, const std::vector<int16_t>& destination,
                                unsigned channels, const std::vector<testsupport::FrameSpan>& spans, uint64_t margin,
                                uint64_t leadIn, double keptDb, double changedDb);

// AAC re-encoded only around the AF intervals (frames of the decoded sound, which begins
// `priming` frames into the track's packets): every packet whose frame lies farther than `away`
// frames from each interval is the source's own, by the tests' own walk of the tables and by
// ffmpeg's packet hashes; and decoding across every joint between the source's packets and
// re-encoded ones stays within coding noise of the source's decode: per channel at least
// `jointDb` of signal over difference, and no sample off by more than `peakShare` of the
// loudest sample around the joint. Empty when that holds, else what does not; `kept` receives
// the share of packets that are the source's own.
std::string CheckSplicedAac(const std::string& source, const std::string& destination, unsigned channels,
                            const std::vector<moviekit::AfInterval>& intervals, uint64_t away, double jointDb,
                            double peakShare, double* kept = nullptr, uint64_t priming = 1024);

// AF intervals as frame spans, moved `shift` frames on.
std::vector<testsupport::FrameSpan> Spans(const std::vector<moviekit::AfInterval>& intervals, uint64_t shift = 0);
// Whether `frame` lies within `margin` frames of an interval or inside one.
bool NearInterval(uint64_t frame, const std::vector<moviekit::AfInterval>& intervals, uint64_t margin);
// PCM processed where it may be only: bit-exact outside every interval widened by `ramp` (the
// library's 10 ms ramp, no other slack), and over half the frames changed inside each interval
// shrunk by it. Empty when that holds, else what does not.
// Samples are int16_t or double.
template <typename Sample>
std::string CheckPcmChangedOnlyInside(const std::vector<Sample>& before, const std::vector<Sample>& after,
                                      unsigned channels, const std::vector<moviekit::AfInterval>& intervals,
                                      uint64_t ramp);

// A top-level atom as its header declares it (size 0 runs to the end of the file).
struct TopAtom {
    std::string type;
    uint64_t offset = 0;
    uint64_t headerSize = 0;
    uint64_t size = 0;
};
// The file's top-level atoms in order; the walk stops at a header that does not fit the file.
std::vector<TopAtom> TopLevelAtoms(const std::string& path);
// Up to `size` bytes from `offset` on, without reading the rest of the file.
std::vector<uint8_t> ReadRange(const std::string& path, uint64_t offset, uint64_t size);
bool Contains(const std::vector<uint8_t>& bytes, const std::string& text);
// Writes the movie as moviekit lays it out, but every single write of at least `holeBytes`
// (video frames, when they are that large) becomes a hole that reads as zeros.
bool WriteSparseMovie(const std::string& path, const moviekit::MovieRecipe& recipe, uint64_t holeBytes,
                      moviekit::MovieLayout* layout, std::string* error);

class HostTest : public ::testing::Test {
protected:
    void SetUp() override;
    void TearDown() override;

    std::string Write(const moviekit::MovieRecipe& recipe, const std::string& name,
                      moviekit::MovieLayout* layout = nullptr);
    // Starts a job and waits for its end; the exported final state.
    int Run(const std::string& source, const std::string& destination);

    testsupport::TempDir m_dir;
};

}  // namespace jobtest

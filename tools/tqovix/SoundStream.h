// The sound of a movie as the processing library is served it: the first sound track,
// decoded through our own pipeline (byte-swapped PCM of any depth we process, or AAC
// through the codecs), frame by frame, with the AF intervals of its maker block placed on
// the same frames.
#pragma once

#include <cstdint>
#include <memory>
#include <string>
#include <vector>

class CTqovixFile;
class CTqovixAtomControl;
class CTqovixAudioDataControlMac;

struct SoundInterval {
    uint64_t start = 0;  // frames of the stream, end exclusive
    uint64_t end = 0;
    uint16_t strength = 0;  // per mille
};

class SoundStream {
public:
    SoundStream();
    ~SoundStream();
    SoundStream(const SoundStream&) = delete;
    SoundStream& operator=(const SoundStream&) = delete;

    // Empty on success, else why the movie's sound cannot be read.
    std::string Open(const std::string& path);
    uint32_t Rate() const { return m_rate; }
    uint32_t Channels() const { return m_channels; }
    uint64_t Frames() const { return m_frames; }
    bool IsAac() const { return m_bAac; }
    // How the frames Read gives are stored (AAC: the decoder's 16-bit integers), and in words.
    uint32_t Bits() const { return m_bits; }
    bool IsFloatingPoint() const { return m_bFloatingPoint; }
    uint32_t FrameBytes() const { return m_channels * (m_bits / 8); }
    std::string Describe() const;
    // Open refused the movie because its sound tables disagree with its chunks.
    bool HasInconsistentTables() const { return m_bInconsistentTables; }
    // The AF intervals of the "AFR1" maker block, on this stream's frames; none for a foreign block.
    const std::vector<SoundInterval>& Intervals() const { return m_intervals; }
    // Up to `frames` interleaved frames, FrameBytes() each, samples in host order; fewer at the
    // end, or where the sound stops short of Frames() (a chunk that cannot be read or decoded).
    uint64_t Read(uint8_t* samples, uint64_t frames);
    // Read's samples on the 16-bit scale (full scale 32768), whatever their format.
    void Levels(const uint8_t* samples, uint64_t frames, double* out) const;
    // Frames read so far.
    uint64_t Position() const { return m_position; }

private:
    std::unique_ptr<CTqovixFile> m_file;
    std::unique_ptr<CTqovixAtomControl> m_tree;
    std::unique_ptr<CTqovixAudioDataControlMac> m_audio;
    uint32_t m_rate = 0;
    uint32_t m_channels = 0;
    uint64_t m_frames = 0;
    uint64_t m_position = 0;
    bool m_bAac = false;
    bool m_bInconsistentTables = false;
    uint32_t m_bits = 16;
    bool m_bFloatingPoint = false;
    bool m_bLittleEndianTrack = false;
    std::vector<SoundInterval> m_intervals;
};

#include "SoundStream.h"

#include <cerrno>
#include <cstring>

#include <algorithm>
#include <cmath>
#include <optional>

#include "atom/CTqovixAtomControl.h"
#include "atom/TqovixEndian.h"
#include "bridge/TqovixInterfaceConvert.h"
#include "codec/CTqovixAudioDataControlMac.h"
#include "file/CTqovixFile.h"
#include "visitor/CTqovixAudioInformationVisitor.h"
#include "visitor/CTqovixMakerBlockVisitor.h"
#include "visitor/CTqovixMovieDataVisitor.h"

namespace {

// The "AFR1" payload: magic, version, flags, rate, count, then 20-byte intervals.
std::vector<SoundInterval> ReadIntervals(const uint8_t* block, uint64_t size, uint32_t rate, int64_t shift,
                                         uint64_t frames)
{
    std::vector<SoundInterval> intervals;
    constexpr uint64_t kHeader = 8;  // the atom's own header comes with the block
    if (block == nullptr || size < kHeader + 16 || std::string(block + kHeader, block + kHeader + 4) != "AFR1") {
        return intervals;
    }
    const uint8_t* payload = block + kHeader;
    const uint32_t recordRate = TqovixReadBE32(payload + 8);
    const uint64_t count = TqovixReadBE32(payload + 12);
    if (count > (size - kHeader - 16) / 20) {
        return intervals;
    }
    const auto place = [&](uint64_t position) {
        const long double scaled = recordRate != 0 && recordRate != rate
                                       ? static_cast<long double>(position) * rate / recordRate
                                       : static_cast<long double>(position);
        return static_cast<uint64_t>(std::clamp<long double>(scaled + shift, 0, static_cast<long double>(frames)));
    };
    for (uint64_t i = 0; i < count; ++i) {
        const uint8_t* entry = payload + 16 + 20 * i;
        const SoundInterval interval{place(TqovixReadBE64(entry)), place(TqovixReadBE64(entry + 8)),
                                     TqovixReadBE16(entry + 16)};
        if (interval.start < interval.end) {
            intervals.push_back(interval);
        }
    }
    return intervals;
}

}  // namespace

SoundStream::SoundStream()
    : m_file(std::make_unique<CTqovixFile>()),
      m_tree(std::make_unique<CTqovixAtomControl>()),
      m_audio(std::make_unique<CTqovixAudioDataControlMac>())
{
}

SoundStream::~SoundStream()
{
    m_audio->Close();
}

std::string SoundStream::Open(const std::string& path)
{
    if (TqovixFailed(m_file->Open(path.c_str(), 1))) {
        return std::string("cannot be opened: ") + std::strerror(errno);
    }
    if (TqovixFailed(m_tree->Initialize(*m_file))) {
        return "not a movie the parser accepts";
    }
    CTqovixAudioInformationVisitor information;
    if (TqovixFailed(m_tree->Analyze(information))) {
        return "no sound track, or its description cannot be read";
    }
    CTqovixTrackListVisitor tracks;
    std::vector<TqovixChunkInformation> chunks;
    if (TqovixFailed(m_tree->Analyze(tracks))) {
        return "the tracks cannot be read";
    }
    for (const TqovixTrackTables& track : tracks.GetTracks()) {
        if (track.index == information.GetTrackIndex() &&
            TqovixFailed(TqovixBuildChunkList(track, information.GetFrameBytes(), chunks))) {
            return "the sound track's tables cannot be read";
        }
    }
    // The time table and the chunks must agree on how much sound there is: otherwise the
    // stream would end early, or pad with silence, and a comparison would measure that.
    uint64_t chunkSamples = 0;
    for (const TqovixChunkInformation& chunk : chunks) {
        chunkSamples += chunk.sampleCount;
    }
    m_bInconsistentTables = information.GetCount() != chunkSamples;
    if (information.GetCount() > chunkSamples) {
        return "the sound track's tables promise more sound than its chunks hold";
    }
    if (information.GetCount() < chunkSamples) {
        return "the sound track's chunks hold more sound than its tables count";
    }
    m_bAac = information.GetAudioSpecificConfigSize() != 0;
    m_rate = information.GetSampleRateHz();
    m_channels = information.GetChannel();
    if (chunks.empty() || m_rate == 0 || m_channels == 0 || m_channels > 8) {
        return "sound that is neither PCM nor AAC of 1 to 8 channels";
    }
    if (!m_bAac) {
        std::string why;
        const auto layout = TqovixSoundEntry::IsPcmFormat(information.GetEntry())
                                ? TqovixSoundEntry::ReadPcmLayout(information.GetEntry(), why)
                                : std::nullopt;
        if (!layout) {
            return why.empty() ? "sound that is neither PCM nor AAC" : why;
        }
        m_bits = layout->bits;
        m_bFloatingPoint = layout->floating;
        m_bLittleEndianTrack = layout->littleEndian;
    }
    if (TqovixFailed(m_audio->Initialize(*m_file, chunks, information.IsBigEndianFormat(), m_bits / 8))) {
        return "the sound cannot be read";
    }
    // The decoder gives up its first packet: what stays is the track less one packet.
    const uint64_t samples = information.GetCount();
    m_frames = m_bAac ? (samples > 0 ? (samples - 1) * 1024 : 0) : samples;
    if (m_bAac) {
        TqovixInterfaceConvert::TqovixAudioInformation record;
        record.sampleRate = m_rate;
        record.channels = m_channels;
        record.bitsPerSample = 16;
        if (TqovixFailed(m_audio->SetAACInformation(nullptr, information.GetAudioSpecificConfigData(),
                                                    information.GetAudioSpecificConfigSize(), record,
                                                    information.GetAverageBitRate()))) {
            return "the AAC decoder cannot be opened";
        }
    }
    CTqovixAFInformationVisitor af;
    if (!TqovixFailed(m_tree->Analyze(af))) {
        const int64_t shift = int64_t{information.GetMediaTime()} - information.GetPriming();
        m_intervals = ReadIntervals(af.GetAFInformation(), af.GetAFInformationSize(), m_rate, shift, m_frames);
    }
    return "";
}

uint64_t SoundStream::Read(uint8_t* samples, uint64_t frames)
{
    frames = std::min(frames, m_frames - m_position);
    const uint64_t frameBytes = FrameBytes();
    const uint64_t bytes = frames * frameBytes;
    // Whole frames a call, so that no sample is cut between two.
    const uint64_t piece = (1 << 20) / frameBytes * frameBytes;
    uint64_t done = 0;
    while (done < bytes) {
        unsigned long got = 0;
        const auto wanted = static_cast<unsigned long>(std::min<uint64_t>(bytes - done, piece));
        if (TqovixFailed(m_audio->PopAudioData(samples + done, &got, wanted)) || got == 0) {
            break;
        }
        done += got;
    }
    const uint64_t read = done / frameBytes;
    m_position += read;
    return read;
}

void SoundStream::Levels(const uint8_t* samples, uint64_t frames, double* out) const
{
    const uint64_t count = frames * m_channels;
    const uint32_t width = m_bits / 8;
    for (uint64_t k = 0; k < count; ++k) {
        const uint8_t* at = samples + k * width;
        if (m_bFloatingPoint && width == 4) {
            float value;
            std::memcpy(&value, at, 4);
            out[k] = static_cast<double>(value) * 32768.0;
        } else if (m_bFloatingPoint) {
            double value;
            std::memcpy(&value, at, 8);
            out[k] = value * 32768.0;
        } else {
            // Little-endian two's complement of any width, scaled to 16 bits.
            uint64_t bits = 0;
            for (uint32_t b = 0; b < width; ++b) {
                bits |= uint64_t{at[b]} << (8 * b);
            }
            const unsigned shift = 64 - 8 * width;
            out[k] = std::ldexp(static_cast<double>(static_cast<int64_t>(bits << shift) >> shift), 16 - static_cast<int>(m_bits));
        }
    }
}

std::string SoundStream::Describe() const
{
    if (m_bAac) {
        return "AAC";
    }
    return std::to_string(m_bits) + (m_bFloatingPoint ? "-bit float" : "-bit") +
           (m_bLittleEndianTrack ? " little-endian" : " big-endian") + " PCM";
}

#include "FuzzTargets.h"

#include <unistd.h>

#include <algorithm>
#include <array>
#include <chrono>
#include <cstdio>
#include <cstdlib>
#include <string>
#include <thread>

#include "atom/CTqovixAtomControl.h"
#include "atom/CTqovixTCTGAtom.h"
#include "atom/TqovixSoundEntry.h"
#include "atom/TqovixTrackAtoms.h"
#include "bridge/TqovixCodeTable.h"
#include "codec/TqovixAacSyntax.h"
#include "engine/CTqovixMainFrame.h"
#include "file/CTqovixFile.h"
#include "visitor/CTqovixAudioDataVisitor.h"
#include "visitor/CTqovixAudioInformationVisitor.h"
#include "visitor/CTqovixMakerBlockVisitor.h"
#include "visitor/CTqovixMovieDataVisitor.h"
#include "visitor/CTqovixTrimInformationVisitor.h"

namespace fuzztarget {

namespace {

// The input as a file in a private directory, removed with the object.
class InputFile {
public:
    InputFile(const uint8_t* data, size_t size)
    {
        char pattern[] = "/tmp/tqovix-fuzz-XXXXXX";
        if (mkdtemp(pattern) != nullptr) {
            m_directory = pattern;
        }
        m_path = m_directory + "/input.mov";
        if (FILE* file = std::fopen(m_path.c_str(), "wb")) {
            if (size != 0) {
                std::fwrite(data, 1, size, file);
            }
            std::fclose(file);
        }
    }
    ~InputFile()
    {
        unlink(m_path.c_str());
        unlink(Output().c_str());
        rmdir(m_directory.c_str());
    }
    const std::string& Path() const { return m_path; }
    std::string Output() const { return m_directory + "/output.mov"; }

private:
    std::string m_directory;
    std::string m_path;
};

// The file still holds exactly the input.
bool Holds(const std::string& path, const uint8_t* data, size_t size)
{
    FILE* file = std::fopen(path.c_str(), "rb");
    if (file == nullptr) {
        return false;
    }
    std::vector<uint8_t> bytes(size + 1);
    const size_t read = std::fread(bytes.data(), 1, bytes.size(), file);
    std::fclose(file);
    return read == size && std::equal(data, data + size, bytes.begin());
}

bool Exists(const std::string& path) { return access(path.c_str(), F_OK) == 0; }

// Whether the movie's AF block carries our own payload, which processing marks; another
// camera's payload is passed through as it is, so its result cannot say it was processed.
bool HasOwnAfPayload(const std::string& path)
{
    CTqovixMovControl control;
    bool own = false;
    if (!TqovixFailed(control.Initialize(path.c_str(), nullptr))) {
        std::array<uint8_t, 12> head{};
        unsigned long delivered = 0;
        own = !TqovixFailed(control.GetAFInformation(head.data(), &delivered, head.size(), 0)) &&
              delivered == head.size() && std::equal(head.begin() + 8, head.end(), "AFR1");
    }
    control.Close();
    return own;
}

// What the property query may answer about a readable file of ours: processable, a verdict, not
// a movie, out of memory. 190 would be an internal failure leaking out as "anything else".
bool IsPropertyAnswer(eTqovixErrorCode code)
{
    constexpr std::array kAnswers = {0, 7, 8, 9, 20, 100};
    return std::ranges::find(kAnswers, TqovixCodes::Exported(code)) != kAnswers.end();
}

// A chunk list as the builder promises it: numbered from 1 in order, each chunk as long as its samples.
bool WellFormed(const std::vector<TqovixChunkInformation>& chunks)
{
    for (size_t k = 0; k < chunks.size(); ++k) {
        const TqovixChunkInformation& chunk = chunks[k];
        uint64_t bytes = 0;
        for (uint32_t sample : chunk.sampleSizes) {
            bytes += sample;
        }
        if (chunk.chunkNumber != k + 1 || (!chunk.sampleSizes.empty() && bytes != chunk.size) ||
            (!chunk.sampleSizes.empty() && chunk.sampleSizes.size() != chunk.sampleCount)) {
            return false;
        }
    }
    return true;
}

// The first track with that handler among all tracks, as the whole-movie walk read it.
const TqovixTrackTables* FirstTrack(const CTqovixTrackListVisitor& tracks, const char (&subtype)[5])
{
    for (const TqovixTrackTables& track : tracks.GetTracks()) {
        if (track.IsHandler(subtype)) {
            return &track;
        }
    }
    return nullptr;
}

}  // namespace

int AtomTree(const uint8_t* data, size_t size)
{
    InputFile input(data, size);
    CTqovixFile file;
    if (TqovixFailed(file.Open(input.Path().c_str(), 1))) {
        return 0;
    }
    CTqovixAtomControl tree;
    if (TqovixFailed(tree.Initialize(file))) {
        return 0;
    }
    // The sound and video walks pick their track themselves; the walk over every track must
    // find the same tables there and build the same chunks from them.
    CTqovixTrackListVisitor tracks;
    const bool listed = !TqovixFailed(tree.Analyze(tracks));
    if (listed) {
        for (const TqovixTrackTables& track : tracks.GetTracks()) {
            std::vector<TqovixChunkInformation> trackChunks;
            if (!TqovixFailed(TqovixBuildChunkList(
                    track, track.soundEntry ? TqovixSoundEntry::FrameBytes(*track.soundEntry) : 0, trackChunks)) &&
                !WellFormed(trackChunks)) {
                return kBrokenChunkList;
            }
        }
    }
    CTqovixAudioInformationVisitor information;
    if (!TqovixFailed(tree.Analyze(information))) {
        CTqovixAudioDataVisitor audio;
        std::vector<TqovixChunkInformation> chunks;
        if (!TqovixFailed(tree.Analyze(audio)) &&
            !TqovixFailed(audio.GetAudioChunkInformation(chunks, information.GetFrameBytes()))) {
            const TqovixTrackTables* sound = listed ? FirstTrack(tracks, "soun") : nullptr;
            std::vector<TqovixChunkInformation> again;
            if (!WellFormed(chunks) || (sound != nullptr && (TqovixFailed(TqovixBuildChunkList(
                                                                  *sound, information.GetFrameBytes(), again)) ||
                                                              again != chunks))) {
                return kWalksDisagree;
            }
        }
    }
    CTqovixMovieDataVisitor video;
    std::vector<TqovixChunkInformation> videoChunks;
    if (!TqovixFailed(tree.Analyze(video)) && !TqovixFailed(video.GetOffset(videoChunks))) {
        const TqovixTrackTables* picture = listed ? FirstTrack(tracks, "vide") : nullptr;
        std::vector<TqovixChunkInformation> again;
        if (!WellFormed(videoChunks) ||
            (picture != nullptr &&
             (TqovixFailed(TqovixBuildChunkList(*picture, 0, again)) || again != videoChunks))) {
            return kWalksDisagree;
        }
    }
    CTqovixTrimInformationVisitor trim;
    tree.Analyze(trim);
    CTqovixAFInformationVisitor af;
    tree.Analyze(af);
    CTqovixAudioLevelInformationVisitor level;
    tree.Analyze(level);
    return 0;
}

int TagCursor(const uint8_t* data, size_t size)
{
    CTqovixTCTGAtom cursor(data, size);
    std::vector<uint8_t> rewritten;
    size_t tags = 0;
    while (cursor.FindNextTag()) {
        // Every tag has an 8-byte header, so more tags than that is a cursor going round.
        if (++tags > size / 8) {
            std::abort();
        }
        TCTG::TqovixTCTGTag tag;
        tag.group = cursor.GetTagGroup();
        tag.number = cursor.GetTagNumber();
        tag.type = cursor.GetTagType();
        tag.count = cursor.GetTagCount();
        const uint8_t* bytes = cursor.GetTag();
        tag.data.assign(bytes + 8, bytes + cursor.GetTagSize());
        CTqovixTCTGAtom::AppendTag(rewritten, tag);
        std::vector<uint32_t> longs;
        std::vector<TCTG::TqovixURational> rationals;
        cursor.GetTagData(longs);
        cursor.GetTagData(rationals);
        const size_t values = cursor.GetTagDataSize() == 4 ? longs.size() : rationals.size();
        if ((cursor.GetTagDataSize() == 4 || cursor.GetTagDataSize() == 8) && values != tag.count) {
            std::abort();
        }
    }
    if (rewritten.size() > size || !std::equal(rewritten.begin(), rewritten.end(), data)) {
        std::abort();
    }
    return 0;
}

int Esds(const uint8_t* data, size_t size)
{
    // A copy of exactly the input's length, so reading one byte past it is caught.
    const std::vector<char> payload(data, data + size);
    CTqovixAudioInformationVisitor visitor;
    if (visitor.Analyze_ESDSAtom(payload.data(), static_cast<unsigned int>(payload.size()))) {
        const uint8_t* config = visitor.GetAudioSpecificConfigData();
        const uint32_t configSize = visitor.GetAudioSpecificConfigSize();
        if (configSize > size ||
            (configSize > 0 && std::search(data, data + size, config, config + configSize) == data + size)) {
            std::abort();
        }
        TqovixAacSyntax::ReadDecoderConfig(config, configSize);
    }
    const std::vector<uint8_t> frame(data, data + size);
    TqovixAacSyntax::ReadFrameHeader(frame.data(), frame.size());
    std::vector<uint8_t> padded;
    const size_t target = size + (size != 0 ? data[size - 1] % 300 : 0);
    if (TqovixAacSyntax::PadToSize(frame.data(), frame.size(), target, padded)) {
        if (padded.size() != target) {
            std::abort();
        }
        TqovixAacSyntax::ReadFrameHeader(padded.data(), padded.size());
    }
    return 0;
}

int TrackAtoms(const uint8_t* data, size_t size)
{
    // A copy of exactly the input's length, so reading one byte past it is caught.
    const std::vector<uint8_t> bytes(data, data + size);
    const TqovixPayload payload(bytes);
    namespace ta = TqovixTrackAtoms;
    ta::ParseHandler(payload);
    ta::ParseMediaTimeScale(payload);
    ta::ParseDataInFile(payload);
    ta::ParseSampleTotal(payload);
    if (const auto edits = ta::ParseEditList(payload)) {
        ta::FirstMediaTime(*edits);
    }
    // What a table reader accepts fits the payload, and writes back as the bytes it came from.
    const auto fits = [&](uint64_t entries, uint64_t width) {
        if (8 + entries * width > size) {
            std::abort();
        }
    };
    if (const auto runs = ta::ParseSampleToChunk(payload)) {
        fits(runs->size(), 12);
    }
    if (const auto sizes = ta::ParseSampleSizes(payload)) {
        fits(sizes->sizes.size(), 4);
    }
    for (const bool wide : {false, true}) {
        const auto offsets = ta::ParseChunkOffsets(payload, wide);
        if (!offsets) {
            continue;
        }
        fits(offsets->size(), wide ? 8 : 4);
        const std::vector<uint8_t> written = ta::WriteChunkOffsets(*offsets, wide);
        if (!std::equal(written.begin() + 4, written.end(), bytes.begin() + 4)) {
            std::abort();
        }
    }
    if (const auto entry = TqovixSoundEntry::Parse(payload)) {
        if (entry->children.data() != nullptr &&
            (entry->children.data() < bytes.data() || entry->children.data() + entry->children.size() > bytes.data() + size)) {
            std::abort();
        }
        if (const auto esds = TqovixSoundEntry::FindEsds(entry->children)) {
            TqovixSoundEntry::ParseEsds(*esds);
        }
        // A layout it accepts is one the library takes: a whole frame of whole samples.
        std::string why;
        if (const auto layout = TqovixSoundEntry::ReadPcmLayout(*entry, why)) {
            const uint32_t width = layout->SampleBytes();
            if ((width != 2 && width != 3 && width != 4 && width != 8) || (layout->floating && width < 4) ||
                (entry->channels != 0 && TqovixSoundEntry::FrameBytes(*entry) != uint64_t{entry->channels} * width)) {
                std::abort();
            }
        } else if (why.empty()) {
            std::abort();
        }
    }
    if (const auto esds = TqovixSoundEntry::FindEsds(payload)) {
        TqovixSoundEntry::ParseEsds(*esds);
    }
    return 0;
}

int Property(const uint8_t* data, size_t size)
{
    InputFile input(data, size);
    CTqovixMainFrame engine;
    g_pMainFrame = &engine;
    int broken = 0;
    if (!TqovixFailed(engine.Initialize())) {
        const eTqovixErrorCode answer = engine.GetProperty(input.Path().c_str());
        if (!IsPropertyAnswer(answer)) {
            broken = kUnlistedPropertyAnswer;
        } else if (engine.GetProperty(input.Path().c_str()) != answer) {
            broken = kPropertyChangedItsMind;
        } else if (!Holds(input.Path(), data, size)) {
            broken = kSourceWritten;
        }
    }
    engine.Close();
    g_pMainFrame = nullptr;
    return broken;
}

int Job(const uint8_t* data, size_t size)
{
    InputFile input(data, size);
    CTqovixMainFrame engine;
    g_pMainFrame = &engine;
    int broken = 0;
    if (!TqovixFailed(engine.Initialize())) {
        const eTqovixErrorCode promised = engine.GetProperty(input.Path().c_str());
        // Refusals come back as failures or as the library's verdicts.
        const bool refused =
            TqovixCodes::Exported(engine.Execute(input.Path().c_str(), input.Output().c_str(), 0)) != 0;
        if (!refused) {
            // A job that does not end in time is a hang worth reporting.
            const auto deadline = std::chrono::steady_clock::now() + std::chrono::seconds(20);
            while (engine.GetProcessingState() == eTqovixRunning) {
                if (std::chrono::steady_clock::now() > deadline) {
                    std::abort();
                }
                std::this_thread::sleep_for(std::chrono::microseconds(100));
            }
        }
        const bool finished = !refused && engine.GetProcessingState() == eTqovixFinished;
        if (TqovixCodes::Exported(promised) == 0 && refused) {
            broken = kRefusedWhatThePropertyAccepted;
        } else if (Exists(input.Output()) != finished) {
            broken = kOutputWithoutSuccess;
        } else if (finished && HasOwnAfPayload(input.Path()) &&
                   TqovixCodes::Exported(engine.GetProperty(input.Output().c_str())) != 20) {
            broken = kOutputNotMarkedProcessed;
        } else if (!Holds(input.Path(), data, size)) {
            broken = kSourceWritten;
        }
    }
    engine.Close();
    g_pMainFrame = nullptr;
    return broken;
}

}  // namespace fuzztarget

// The movie controller's analysis of the source's tracks: which sound track is
// processed and whether it can be, and which tracks are carried unchanged.
#include <algorithm>
#include <new>
#include <numeric>
#include <optional>
#include <string_view>

#include "atom/CTqovixContainerAtom.h"
#include "codec/AACEncoder.h"
#include "codec/TqovixAacSyntax.h"
#include "movie/CTqovixMovControl.h"
#include "visitor/CTqovixAudioInformationVisitor.h"
#include "visitor/CTqovixMovieDataVisitor.h"

namespace {

constexpr uint32_t kMaxPcmChannels = 8;  // what the processing library takes
constexpr uint32_t kMaxRateKiloHertz = 1000;  // likewise
constexpr uint32_t kMaxAacChannels = 2;
constexpr uint8_t kAacLowComplexity = 2;

// Messages are appended piece by piece: `"text" + std::string` trips a false -Werror=restrict
// in some optimising compilers.
std::string Words(std::initializer_list<std::string_view> pieces)
{
    std::string text;
    for (std::string_view piece : pieces) {
        text.append(piece);
    }
    return text;
}

std::string FourCC(eTqovixAtomType type) { return Words({"'", TqovixAtomTypeName(type), "'"}); }

std::string TrackName(const TqovixTrackTables& track)
{
    const std::string kind = track.handler ? FourCC(track.handler->subtype) : "without a handler";
    return Words({"track ", std::to_string(track.index + 1), " (", kind, ")"});
}

bool IsFragmented(const TqovixAtomList& atoms)
{
    for (const auto& atom : atoms) {
        if (atom->GetType() == TqovixMakeAtomType("moof")) {
            return true;
        }
        const auto* moov = atom->GetType() == TqovixAtom::kMoov ? dynamic_cast<const CTqovixContainerAtom*>(atom.get())
                                                                 : nullptr;
        if (moov != nullptr && atom->IsExistAtom(moov->GetChildren(), TqovixMakeAtomType("mvex"))) {
            return true;
        }
    }
    return false;
}

}  // namespace

eTqovixErrorCode CTqovixMovControl::Refuse(eTqovixErrorCode code, eTqovixRefusal kind, std::string reason)
{
    m_refusalKind = kind;
    m_refusal = std::move(reason);
    return code;
}

eTqovixErrorCode CTqovixMovControl::RefuseFragmented()
{
    TqovixAtomList atoms;
    const eTqovixErrorCode result = m_atomControl.GetAtoms(atoms);
    if (TqovixFailed(result)) {
        return result;
    }
    return IsFragmented(atoms) ? Refuse(eTqovixErrorInvalidMovie, eTqovixRefusal::Fragmented, "fragmented movie") : eTqovixSuccess;
}

eTqovixErrorCode CTqovixMovControl::AnalyzeTracks(bool forJob)
{
    TqovixAtomList atoms;
    eTqovixErrorCode result = m_atomControl.GetAtoms(atoms);
    if (TqovixFailed(result)) {
        return result;
    }
    CTqovixAudioInformationVisitor information;
    result = m_atomControl.Analyze(information);
    if (TqovixFailed(result)) {
        return result != eTqovixErrorInvalidMovie ? result
                                                  : Refuse(result, eTqovixRefusal::NoSoundTrack, "no sound track, or its description cannot be read");
    }
    result = AnalyzeSoundFormat(information);
    if (TqovixFailed(result)) {
        return result;
    }
    long long fileSize = 0;
    result = m_sourceFile.GetFileSize(&fileSize);
    if (TqovixFailed(result)) {
        return result;
    }
    m_soundTrackIndex = information.GetTrackIndex();
    result = GatherCarriedTracks(m_soundTrackIndex, m_bPCM ? m_frameBytes : 0, static_cast<uint64_t>(fileSize));
    if (TqovixFailed(result)) {
        return result;
    }
    // A track that claims more sound than its chunks hold would have the library pull
    // silence for as long as the claim says: refuse it.
    uint64_t chunkSamples = 0;
    for (const TqovixChunkInformation& chunk : m_audioChunks) {
        chunkSamples += chunk.sampleCount;
    }
    if (information.GetCount() == 0) {
        return Refuse(eTqovixErrorInvalidMovie, eTqovixRefusal::Malformed, "the sound track's tables hold no samples");
    }
    if (m_audioChunks.empty() || information.GetCount() > chunkSamples) {
        return Refuse(eTqovixErrorInvalidMovie, eTqovixRefusal::Malformed, "the sound track's tables promise more sound than its chunks hold");
    }
    // The AAC writer closes a chunk with the packet that fills it: a chunk of no packets is never
    // closed and the tables written after would not match. Refused here, where the property
    // query decides too. (Uncompressed sound counts bytes, and an empty chunk is simply passed.)
    if (!m_bPCM) {
        for (const TqovixChunkInformation& chunk : m_audioChunks) {
            if (chunk.sampleCount == 0) {
                return Refuse(eTqovixErrorInvalidMovie, eTqovixRefusal::UnsupportedLayout,
                              Words({"AAC sound chunk ", std::to_string(chunk.chunkNumber), " holds no packets"}));
            }
        }
        result = ExamineAacSplicing(information);
        if (TqovixFailed(result)) {
            return result;
        }
        // A chunk is held whole before it is laid out, so its size bounds what is held.
        constexpr uint64_t kMaxGatheredBytes = 4 << 20;
        constexpr uint32_t kMaxGatheredPackets = 8192;
        m_bGatherAacChunks = std::ranges::all_of(m_audioChunks, [](const TqovixChunkInformation& chunk) {
            return chunk.size <= kMaxGatheredBytes && chunk.sampleCount <= kMaxGatheredPackets;
        });
    }
    if (!forJob) {
        // The property query sets the sound up as a job's start does, so that it refuses what
        // the start would.
        return m_audioDataControl.Initialize(m_sourceFile, m_audioChunks, m_bBigEndian, m_sampleBytes);
    }
    // Whether copying then patching will do, so that the sound served from now on is kept to
    // compare with; the writer decides for good when it starts.
    bool largeSource = false;
    for (const auto& atom : atoms) {
        largeSource = largeSource || (atom->GetType() == TqovixAtom::kMdat && atom->GetSize() > UINT32_MAX);
    }
    uint64_t moovOffset = 0;
    m_bLargeMediaDataHeader = NeedsLargeMediaDataHeader(largeSource);
    m_bPatchCandidate = CanPatch(atoms, moovOffset);
    return m_audioDataControl.Initialize(m_sourceFile, m_audioChunks, m_bBigEndian, m_sampleBytes);
}

eTqovixErrorCode CTqovixMovControl::AnalyzeSoundFormat(const CTqovixAudioInformationVisitor& information)
{
    const TqovixSoundEntry::Entry& entry = information.GetEntry();
    const uint32_t channels = information.GetChannel();
    if (information.GetRate() == 0) {
        return Refuse(eTqovixErrorInvalidMovie, eTqovixRefusal::UnsupportedSound, "sound has no sample rate");
    }
    if (information.GetRate() > kMaxRateKiloHertz) {
        return Refuse(eTqovixErrorInvalidMovie, eTqovixRefusal::UnsupportedSound,
                      Words({"sound at ", std::to_string(information.GetEntry().sampleRateHz), " Hz is not processed"}));
    }
    if (TqovixSoundEntry::IsAac(entry)) {
        const uint8_t objectType = information.GetAudioSpecificConfigData()[0] >> 3;
        if (objectType != kAacLowComplexity) {
            return Refuse(eTqovixErrorInvalidMovie, eTqovixRefusal::UnsupportedSound,
                          Words({"sound is AAC of object type ", std::to_string(objectType), "; only AAC-LC is processed"}));
        }
        if (channels == 0 || channels > kMaxAacChannels) {
            return Refuse(eTqovixErrorInvalidMovie, eTqovixRefusal::UnsupportedSound, Words({"sound is AAC with ", std::to_string(channels),
                                                           " channels; only mono and stereo AAC are processed"}));
        }
        m_bPCM = false;
        m_bBigEndian = false;
        m_bFloatingPoint = false;
        m_sampleBits = 16;  // what the decoder gives
        m_sampleBytes = 2;
        m_frameBytes = 2 * channels;
        return eTqovixSuccess;
    }
    if (!TqovixSoundEntry::IsPcmFormat(entry)) {
        return Refuse(eTqovixErrorInvalidMovie, eTqovixRefusal::UnsupportedSound, Words({"sound format ", FourCC(entry.format), " is not processed"}));
    }
    if (channels == 0 || channels > kMaxPcmChannels) {
        return Refuse(eTqovixErrorInvalidMovie, eTqovixRefusal::UnsupportedSound,
                      Words({"sound has ", std::to_string(channels), " channels; 1 to 8 are processed"}));
    }
    std::string why;
    const std::optional<TqovixSoundEntry::PcmLayout> layout = TqovixSoundEntry::ReadPcmLayout(entry, why);
    if (!layout) {
        return Refuse(eTqovixErrorInvalidMovie, eTqovixRefusal::UnsupportedSound, std::move(why));
    }
    m_bPCM = true;
    m_bBigEndian = !layout->littleEndian;
    m_bFloatingPoint = layout->floating;
    m_sampleBits = layout->bits;
    m_sampleBytes = layout->SampleBytes();
    m_frameBytes = m_sampleBytes * channels;
    return eTqovixSuccess;
}

eTqovixErrorCode CTqovixMovControl::ExamineAacSplicing(const CTqovixAudioInformationVisitor& information)
{
    // A few packets from the start, the middle and the end show how the source's encoder works.
    constexpr uint64_t kLooked = 16;
    try {
        m_chunkFirstPacket.assign(1, 0);
        for (const TqovixChunkInformation& chunk : m_audioChunks) {
            m_chunkFirstPacket.push_back(m_chunkFirstPacket.back() + chunk.sampleCount);
        }
    } catch (const std::bad_alloc&) {
        return eTqovixErrorOutOfMemory;
    }
    const uint32_t channels = information.GetChannel();
    const std::optional<TqovixAacSyntax::DecoderConfig> config = TqovixAacSyntax::ReadDecoderConfig(
        information.GetAudioSpecificConfigData(), information.GetAudioSpecificConfigSize());
    if (!config || config->objectType != 2) {
        m_aacWholeReason = "its decoder configuration is not the low complexity profile our encoder writes";
    } else if (config->sampleRate != information.GetSampleRateHz()) {
        m_aacWholeReason = Words({"its decoder configuration says ", std::to_string(config->sampleRate),
                                  " Hz where the track has ", std::to_string(information.GetSampleRateHz()), " Hz"});
    } else if (config->channelConfiguration != channels) {
        m_aacWholeReason = Words({"its decoder configuration lays out the channels as configuration ",
                                  std::to_string(config->channelConfiguration), ", not as ", std::to_string(channels),
                                  channels == 1 ? " channel" : " channels", " the way our encoder does"});
    } else if (config->shortFrames || config->dependsOnCoreCoder || config->extension) {
        m_aacWholeReason = "its decoder configuration asks for frames of 960 samples, a core coder or extensions our "
                           "encoder does not write";
    }
    const uint64_t packets = m_chunkFirstPacket.back();
    const uint8_t element = channels == 1 ? TqovixAacSyntax::kSce : TqovixAacSyntax::kCpe;
    std::vector<uint8_t> packet;
    for (const uint64_t from : {uint64_t{0}, packets / 2, packets > kLooked ? packets - kLooked : 0}) {
        for (uint64_t index = from; index < std::min(packets, from + kLooked) && m_aacWholeReason.empty(); ++index) {
            const eTqovixErrorCode result = ReadSourcePacket(index, packet);
            // A file that cannot be read fails here as it would a moment later; a packet the
            // tables cannot give is the decoder's to refuse.
            if (TqovixFailed(result) && result != eTqovixErrorInternal) {
                return result;
            }
            const std::optional<TqovixAacSyntax::FrameHeader> header =
                TqovixFailed(result) ? std::nullopt : TqovixAacSyntax::ReadFrameHeader(packet.data(), packet.size());
            if (!header || header->element != element) {
                m_aacWholeReason = Words({"packet ", std::to_string(index + 1), channels == 1
                                                                                    ? " does not begin with one channel"
                                                                                    : " does not begin with a channel pair"});
            } else if (header->windowSequence == TqovixAacSyntax::kOnlyLong &&
                       header->windowShape != AACEncoder::kLongWindowShape) {
                // A decoder shapes the first half of a frame as the frame before it said: after one
                // of the source's, ours would not cancel what its overlap leaves.
                m_aacWholeReason = AACEncoder::kLongWindowShape == 1
                                       ? "its long frames use sine windows where our encoder uses Kaiser-Bessel ones"
                                       : "its long frames use Kaiser-Bessel windows where our encoder uses sine ones";
            }
        }
    }
    return eTqovixSuccess;
}

eTqovixErrorCode CTqovixMovControl::GatherCarriedTracks(uint32_t soundTrack, uint32_t soundFrameBytes,
                                                        uint64_t fileSize)
{
    CTqovixTrackListVisitor list;
    eTqovixErrorCode result = m_atomControl.Analyze(list);
    if (TqovixFailed(result)) {
        return result == eTqovixErrorInvalidMovie ? Refuse(result, eTqovixRefusal::Malformed, "the movie's tracks cannot be read") : result;
    }
    std::vector<TqovixChunkInformation> carried;
    std::vector<uint32_t> owners;
    try {
        for (const TqovixTrackTables& track : list.GetTracks()) {
            if (track.index == soundTrack) {
                if (!track.dataInFile) {
                    return Refuse(eTqovixErrorInvalidMovie, eTqovixRefusal::UnsupportedLayout, "the sound track's media lies in another file");
                }
                result = TqovixBuildChunkList(track, soundFrameBytes, m_audioChunks);
                if (TqovixFailed(result)) {
                    return result == eTqovixErrorInvalidMovie
                               ? Refuse(result, eTqovixRefusal::Malformed, "the sound track's sample tables contradict each other")
                               : result;
                }
                continue;
            }
            // A track whose media lies elsewhere keeps its tables as they are.
            if (!track.dataInFile) {
                continue;
            }
            uint32_t frameBytes = 0;
            if (track.IsHandler("soun") && track.soundEntry && TqovixSoundEntry::IsPcmFormat(*track.soundEntry)) {
                frameBytes = TqovixSoundEntry::FrameBytes(*track.soundEntry);
            } else if (track.IsHandler("soun") && track.sizes && track.sizes->common == 1) {
                // Compressed sound counted in bytes: its chunk sizes cannot be known for sure.
                return Refuse(eTqovixErrorInvalidMovie, eTqovixRefusal::UnsupportedLayout, Words({TrackName(track), ": chunk sizes of format ",
                                                               FourCC(track.format), " cannot be determined"}));
            }
            std::vector<TqovixChunkInformation> chunks;
            result = TqovixBuildChunkList(track, frameBytes, chunks);
            if (TqovixFailed(result)) {
                return result == eTqovixErrorInvalidMovie
                           ? Refuse(result, eTqovixRefusal::Malformed, Words({TrackName(track), ": sample tables contradict each other"}))
                           : result;
            }
            if (TqovixFailed(TqovixCheckChunksInFile(chunks, fileSize))) {
                return Refuse(eTqovixErrorInvalidMovie, eTqovixRefusal::Malformed, Words({TrackName(track), ": chunks lie past the end of the file"}));
            }
            m_carriedTracks.emplace_back(track.index, chunks.size());
            carried.insert(carried.end(), chunks.begin(), chunks.end());
            owners.insert(owners.end(), chunks.size(), track.index);
        }
        if (TqovixFailed(TqovixCheckChunksInFile(m_audioChunks, fileSize))) {
            return Refuse(eTqovixErrorInvalidMovie, eTqovixRefusal::Malformed, "the sound track's chunks lie past the end of the file");
        }
        // Carried chunks go out in source order, whatever track they belong to.
        std::vector<size_t> order(carried.size());
        std::iota(order.begin(), order.end(), size_t{0});
        std::stable_sort(order.begin(), order.end(),
                         [&](size_t a, size_t b) { return carried[a].offset < carried[b].offset; });
        m_movieDataChunks.reserve(order.size());
        m_movieDataChunkTracks.reserve(order.size());
        for (size_t k : order) {
            m_movieDataChunks.push_back(std::move(carried[k]));
            m_movieDataChunkTracks.push_back(owners[k]);
        }
    } catch (const std::bad_alloc&) {
        return eTqovixErrorOutOfMemory;
    }
    return eTqovixSuccess;
}

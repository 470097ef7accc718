#include "visitor/CTqovixAudioInformationVisitor.h"

#include <new>

#include "atom/CTqovixLeafAtom.h"
#include "atom/TqovixTrackAtoms.h"
#include "visitor/TqovixTrackPath.h"

using namespace TqovixTrackPath;

namespace {

std::span<const uint8_t> PayloadOf(const CTqovixLeafAtom& atom, bool& loaded)
{
    const uint64_t size = atom.GetDataSize();
    const uint8_t* data = size == 0 ? nullptr : atom.GetData();
    loaded = size == 0 || data != nullptr;
    return data == nullptr ? std::span<const uint8_t>{} : std::span<const uint8_t>{data, static_cast<size_t>(size)};
}

}  // namespace

bool CTqovixAudioInformationVisitor::IsNecessary(const TqovixAtomPath& path) const
{
    const eTqovixAtomType last = path.empty() ? eTqovixAtomType{} : path.back();
    static const TqovixAtomPath editList = TqovixMakeAtomPath("moovtrakedtselst");
    static const TqovixAtomPath edits = TqovixMakeAtomPath("moovtrakedts");
    static const TqovixAtomPath handler = TqovixMakeAtomPath("moovtrakmdiahdlr");
    const TqovixAtomPath& wanted = last == kElst                  ? editList
                                   : last == TqovixAtom::kEdts     ? edits
                                   : last == kHdlr                 ? handler
                                                                   : SampleTablePath();
    return IsWanted(path, wanted, {kStsd, kHdlr, TqovixAtom::kEdts, kStts, kElst});
}

eTqovixErrorCode CTqovixAudioInformationVisitor::IsSoundMediaTrack(const CTqovixLeafAtom& handler) const
{
    return HandlerAnswer(handler, "soun");
}

void CTqovixAudioInformationVisitor::BeginTrack() const
{
    m_trackIndex = static_cast<uint32_t>(++m_tracksSeen);
    m_bSoundTrack = false;
    m_bDescription = false;
    m_bTimeToSample = false;
    m_bEditList = false;
    m_failure = eTqovixSuccess;
    m_sampleTotal = 0;
    m_mediaTime = 0;
    m_audioSpecificConfigSize = 0;
    m_averageBitRate = 0;
    m_audioSpecificConfig.clear();
    m_bBigEndianPcm = true;
}

eTqovixErrorCode CTqovixAudioInformationVisitor::Analyze(const TqovixAtomPath& path, const CTqovixContainerAtom&) const
{
    if (!IsNecessary(path)) {
        return eTqovixVisitSkip;
    }
    if (path.size() == 2 && path[1] == TqovixAtom::kTrak) {
        BeginTrack();
    }
    return eTqovixVisitContinue;
}

eTqovixErrorCode CTqovixAudioInformationVisitor::Update(const TqovixAtomPath&, CTqovixContainerAtom&) const
{
    return eTqovixErrorInternal;
}

eTqovixErrorCode CTqovixAudioInformationVisitor::Update(const TqovixAtomPath&, CTqovixLeafAtom&) const
{
    return eTqovixErrorInternal;
}

eTqovixErrorCode CTqovixAudioInformationVisitor::Analyze(const TqovixAtomPath& path, const CTqovixLeafAtom& atom) const
{
    if (!IsNecessary(path)) {
        return eTqovixVisitSkip;
    }
    if (path.empty()) {
        return eTqovixErrorInternal;
    }
    const eTqovixAtomType type = atom.GetType();
    if (type == kHdlr) {
        const eTqovixErrorCode answer = IsSoundMediaTrack(atom);
        m_bSoundTrack = answer == eTqovixVisitContinue;
        return answer;
    }
    bool loaded = false;
    const std::span<const uint8_t> payload = PayloadOf(atom, loaded);
    if (!loaded) {
        return eTqovixVisitSkip;  // the leaf reports its read failure to the walk
    }
    bool readable = true;
    if (type == kStsd) {
        m_bDescription = true;
        const eTqovixErrorCode described = AnalyzeSampleDescription(payload);
        readable = !TqovixFailed(described);
    } else if (type == kStts) {
        const std::optional<uint64_t> total = TqovixTrackAtoms::ParseSampleTotal(payload);
        // More samples than the count can say is no track we can serve.
        readable = total && *total <= UINT32_MAX;
        m_sampleTotal = readable ? static_cast<uint32_t>(*total) : 0;
        m_bTimeToSample = readable;
    } else if (type == kElst) {
        const auto edits = TqovixTrackAtoms::ParseEditList(payload);
        const int64_t mediaTime = edits ? TqovixTrackAtoms::FirstMediaTime(*edits) : -1;
        readable = mediaTime >= 0 && mediaTime <= UINT32_MAX;
        m_mediaTime = readable ? static_cast<uint32_t>(mediaTime) : 0;
        m_bEditList = readable;
    }
    if (!readable && !TqovixFailed(m_failure)) {
        m_failure = eTqovixErrorInvalidMovie;
    }
    return eTqovixVisitContinue;
}

eTqovixErrorCode CTqovixAudioInformationVisitor::Leave(const TqovixAtomPath& path, const CTqovixContainerAtom&) const
{
    if (path.size() != 2 || path[1] != TqovixAtom::kTrak || !m_bSoundTrack) {
        return eTqovixVisitSkip;
    }
    // The first sound track decides: it is read whole, or the movie is refused.
    if (TqovixFailed(m_failure)) {
        return m_failure;
    }
    if (!m_bDescription || !m_bTimeToSample || (m_bNeedMediaTime && !m_bEditList)) {
        return eTqovixErrorInvalidMovie;
    }
    return eTqovixSuccess;
}

eTqovixErrorCode CTqovixAudioInformationVisitor::AnalyzeSampleDescription(std::span<const uint8_t> payload) const
{
    const std::optional<TqovixSoundEntry::Entry> entry = TqovixSoundEntry::Parse(payload);
    if (!entry) {
        return eTqovixErrorInvalidMovie;
    }
    m_entry = *entry;
    m_channelCount = entry->channels > UINT16_MAX ? 0 : static_cast<uint16_t>(entry->channels);
    m_sampleBits = entry->bitsPerChannel > UINT16_MAX ? 0 : static_cast<uint16_t>(entry->bitsPerChannel);
    m_sampleRateHz = entry->sampleRateHz;
    m_rate = entry->sampleRateHz / 1000;
    m_bBigEndianPcm = !TqovixSoundEntry::IsLittleEndianPcm(*entry);
    if (!TqovixSoundEntry::IsAac(*entry)) {
        m_entry.children = {};
        return eTqovixSuccess;
    }
    const auto esds = TqovixSoundEntry::FindEsds(entry->children);
    m_entry.children = {};
    if (!esds || esds->size() > UINT32_MAX ||
        !Analyze_ESDSAtom(reinterpret_cast<const char*>(esds->data()), static_cast<unsigned int>(esds->size()))) {
        return eTqovixErrorInvalidMovie;
    }
    if (m_audioSpecificConfigSize == 0 || m_averageBitRate == 0) {
        return eTqovixErrorInvalidMovie;
    }
    // ISO files write a template channel count; the stream's own configuration says what it holds.
    const uint8_t channelConfig = m_audioSpecificConfigSize >= 2 ? (m_audioSpecificConfig[1] >> 3) & 0x0F : 0;
    if (channelConfig >= 1 && channelConfig <= 7) {
        m_channelCount = channelConfig == 7 ? 8 : channelConfig;
    }
    return eTqovixSuccess;
}

bool CTqovixAudioInformationVisitor::Analyze_ESDSAtom(const char* data, unsigned int size) const
{
    if (data == nullptr) {
        return false;
    }
    const auto config = TqovixSoundEntry::ParseEsds({reinterpret_cast<const uint8_t*>(data), size});
    if (!config) {
        return false;
    }
    try {
        m_audioSpecificConfig = config->audioSpecificConfig;
    } catch (const std::bad_alloc&) {
        return false;
    }
    m_audioSpecificConfigSize = static_cast<uint32_t>(m_audioSpecificConfig.size());
    m_averageBitRate = config->averageBitRate;
    return true;
}

uint32_t CTqovixAudioInformationVisitor::GetFrameBytes() const
{
    return m_audioSpecificConfigSize != 0 || !TqovixSoundEntry::IsPcmFormat(m_entry) ? 0
                                                                                     : TqovixSoundEntry::FrameBytes(m_entry);
}

#include "visitor/CTqovixAudioInformationVisitor.h"

#include <cstring>

#include "atom/CTqovixLeafAtom.h"
#include "atom/TqovixEndian.h"
#include "visitor/TqovixTrackPath.h"

using namespace TqovixTrackPath;

namespace {

constexpr uint8_t kESDescrTag = 3;
constexpr uint8_t kDecoderConfigDescrTag = 4;
constexpr uint8_t kDecSpecificInfoTag = 5;

// A descriptor's size: one byte of 0 to 127, or 0x80 0x80 0x80 n. Any other
// form is refused, as is a size running past what holds the descriptor.
bool ReadDescriptorSize(const uint8_t* data, unsigned int left, unsigned int* size, unsigned int* headerSize)
{
    if (left >= 1 && data[0] < 0x80) {
        *size = data[0];
        *headerSize = 1;
        return true;
    }
    if (left >= 4 && data[0] == 0x80 && data[1] == 0x80 && data[2] == 0x80 && data[3] < 0x80) {
        *size = data[3];
        *headerSize = 4;
        return true;
    }
    return false;
}

// Walks tag-size-body descriptors until `size` is used up exactly; `handle`
// sees each one and may stop the walk with false.
template <typename Handler>
bool WalkDescriptors(const uint8_t* data, unsigned int size, Handler&& handle)
{
    unsigned int offset = 0;
    while (offset < size) {
        const uint8_t tag = data[offset];
        unsigned int bodySize = 0;
        unsigned int sizeBytes = 0;
        if (!ReadDescriptorSize(data + offset + 1, size - offset - 1, &bodySize, &sizeBytes)) {
            return false;
        }
        const unsigned int body = offset + 1 + sizeBytes;
        if (bodySize > size - body) {
            return false;
        }
        if (!handle(tag, data + body, bodySize)) {
            return false;
        }
        offset = body + bodySize;
    }
    return true;
}

const uint8_t* Bytes(const char* data) { return reinterpret_cast<const uint8_t*>(data); }

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
    return IsWanted(path, wanted, {kStsd, kEsds, kHdlr, TqovixAtom::kEdts, kStts, kElst});
}

eTqovixErrorCode CTqovixAudioInformationVisitor::IsSoundMediaTrack(const CTqovixLeafAtom& handler) const
{
    return HandlerAnswer(handler, "soun");
}

eTqovixErrorCode CTqovixAudioInformationVisitor::Analyze(const TqovixAtomPath& path, const CTqovixContainerAtom&) const
{
    return IsNecessary(path) ? eTqovixVisitContinue : eTqovixVisitSkip;
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
    const uint64_t size = atom.GetDataSize();
    const uint8_t* payload = size == 0 ? nullptr : atom.GetData();
    if (!m_bSoundTrack || payload == nullptr) {
        return eTqovixVisitSkip;
    }
    if (type == kStsd) {
        return AnalyzeSampleDescription(payload, size);
    }
    if (type == kStts) {
        return AnalyzeTimeToSample(payload, size);
    }
    if (type == kElst) {
        if (size < 20) {
            return eTqovixErrorInvalidMovie;  // no whole first entry to take the media time from
        }
        m_mediaTime = TqovixReadBE32(payload + 12);
        m_bNeedMediaTime = false;
        return eTqovixSuccess;
    }
    return eTqovixErrorInternal;
}

eTqovixErrorCode CTqovixAudioInformationVisitor::AnalyzeSampleDescription(const uint8_t* payload, uint64_t size) const
{
    // Every field read below lies in the first 44 bytes.
    if (size < 44 || size > UINT32_MAX) {
        return eTqovixErrorInvalidMovie;
    }
    if (std::memcmp(payload + 12, "mp4a", 4) == 0) {
        for (uint64_t p = 16; p + 4 <= size; ++p) {
            if (std::memcmp(payload + p, "esds", 4) != 0) {
                continue;
            }
            const uint32_t esdsSize = TqovixReadBE32(payload + p - 4);
            if (esdsSize < 8 || esdsSize > size - (p - 4) ||
                !Analyze_ESDSAtom(reinterpret_cast<const char*>(payload + p + 4), esdsSize - 8)) {
                return eTqovixErrorInvalidMovie;
            }
            break;
        }
        if (m_audioSpecificConfigSize == 0 || m_averageBitRate == 0) {
            return eTqovixErrorInvalidMovie;
        }
    } else if (std::memcmp(payload + 12, "sowt", 4) == 0) {
        m_bBigEndianPcm = false;
    }
    m_channelCount = TqovixReadBE16(payload + 32);
    m_sampleBits = TqovixReadBE16(payload + 34);
    if (TqovixReadBE16(payload + 24) > 1) {
        return eTqovixErrorInvalidMovie;
    }
    m_rate = TqovixReadBE32(payload + 40) / 65536000U;
    return CountLeaf();
}

eTqovixErrorCode CTqovixAudioInformationVisitor::AnalyzeTimeToSample(const uint8_t* payload, uint64_t size) const
{
    // Whole entries only: a count cut off from its duration is not a sample run.
    uint64_t total = m_sampleTotal;
    for (uint64_t offset = 8; offset + 8 <= size; offset += 8) {
        total += TqovixReadBE32(payload + offset);
    }
    if (total > UINT32_MAX) {
        return eTqovixErrorInvalidMovie;  // more samples than the count can say
    }
    m_sampleTotal = static_cast<uint32_t>(total);
    return CountLeaf();
}

eTqovixErrorCode CTqovixAudioInformationVisitor::CountLeaf() const
{
    if (++m_leafCounter < 2) {
        return eTqovixVisitSkip;
    }
    m_leafCounter = 0;
    // With an edit list the walk goes on to read its media time.
    return m_bNeedMediaTime ? eTqovixVisitContinue : eTqovixSuccess;
}

bool CTqovixAudioInformationVisitor::Analyze_ESDSAtom(const char* data, unsigned int size) const
{
    if (data == nullptr || size <= 4) {
        return false;
    }
    bool result = false;
    const bool walked = WalkDescriptors(Bytes(data) + 4, size - 4, [&](uint8_t tag, const uint8_t* body, unsigned int length) {
        if (tag == kESDescrTag) {
            result = Analyze_ESDescrTag(reinterpret_cast<const char*>(body), length);
        }
        return true;
    });
    return walked && result;
}

bool CTqovixAudioInformationVisitor::Analyze_ESDescrTag(const char* data, unsigned int size) const
{
    const uint8_t* bytes = Bytes(data);
    if (size < 3) {
        return false;
    }
    const uint8_t flags = bytes[2];
    unsigned int offset = 3;
    if ((flags & 0x80) != 0) {
        offset += 2;  // dependsOn_ES_ID
    }
    if ((flags & 0x40) != 0) {
        if (offset >= size) {
            return false;
        }
        offset += 1 + bytes[offset];  // URL length and URL
    }
    if ((flags & 0x20) != 0) {
        offset += 2;  // OCR_ES_Id
    }
    if (offset >= size) {
        return false;
    }
    return WalkDescriptors(bytes + offset, size - offset, [&](uint8_t tag, const uint8_t* body, unsigned int length) {
        return tag != kDecoderConfigDescrTag || Analyze_DecoderConfigDescrTag(reinterpret_cast<const char*>(body), length);
    });
}

bool CTqovixAudioInformationVisitor::Analyze_DecoderConfigDescrTag(const char* data, unsigned int size) const
{
    const uint8_t* bytes = Bytes(data);
    if (size < 13) {
        return false;
    }
    m_averageBitRate = TqovixReadBE32(bytes + 9);
    if (size < 15 || bytes[13] != kDecSpecificInfoTag) {
        return false;
    }
    unsigned int configSize = 0;
    unsigned int sizeBytes = 0;
    if (!ReadDescriptorSize(bytes + 14, size - 14, &configSize, &sizeBytes) || configSize > size - 14 - sizeBytes) {
        return false;
    }
    m_audioSpecificConfig.assign(bytes + 14 + sizeBytes, bytes + 14 + sizeBytes + configSize);
    m_audioSpecificConfigSize = configSize;
    // Anything after the decoder-specific information (a profile descriptor) is not understood.
    return 14 + sizeBytes + configSize == size;
}

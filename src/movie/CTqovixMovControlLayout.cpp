// The movie controller laying out the destination: the leading atoms and the one
// new mdat header before any media, and at the end every moved track's tables,
// the maker blocks, the moov and the mdat's final size.
#include <cstring>
#include <new>

#include "atom/CTqovixAtom.h"
#include "atom/TqovixEndian.h"
#include "movie/CTqovixMovControl.h"
#include "visitor/CTqovixMakerBlockVisitor.h"
#include "visitor/CTqovixMovieDataVisitor.h"
#include "visitor/CTqovixTCTGAtomVisitor.h"

namespace {

constexpr uint64_t kMax32 = CTqovixAtom::kMaxCompactAtomSize;
// Room for an AAC track re-encoded larger than its source when choosing the mdat header.
constexpr uint64_t kAacGrowthMargin = 1 << 20;

}  // namespace

bool CTqovixMovControl::NeedsLargeMediaDataHeader(bool largeSource) const
{
    // One mdat for all media, whatever the source had; its size form is chosen now from
    // what will go in, because the header cannot grow once media follows it.
    uint64_t projected = kAacGrowthMargin;
    for (const auto& chunk : m_movieDataChunks) {
        projected += chunk.size;
    }
    for (const auto& chunk : m_audioChunks) {
        projected += m_bPCM ? chunk.size : 2 * uint64_t{chunk.size};
    }
    return largeSource || projected + 16 > kMax32;
}

eTqovixErrorCode CTqovixMovControl::WriteLeadingAtoms()
{
    TqovixAtomList atoms;
    eTqovixErrorCode result = m_atomControl.GetAtoms(atoms);
    if (TqovixFailed(result)) {
        return result;
    }
    bool largeSource = false;
    for (const auto& atom : atoms) {
        largeSource = largeSource || (atom->GetType() == TqovixAtom::kMdat && atom->GetSize() > kMax32);
    }
    m_bLargeMediaDataHeader = NeedsLargeMediaDataHeader(largeSource);
    bool patching = false;
    result = BeginPatching(patching);
    if (TqovixFailed(result)) {
        return result;
    }
    if (!patching) {
        result = WriteMediaDataHeader(atoms);
        if (TqovixFailed(result)) {
            return result;
        }
    }
    try {
        // A patched copy holds every chunk where it was; the general writer places AAC's anew.
        if (m_bPCM || patching) {
            m_outputAudioChunks = m_audioChunks;
        }
        m_outputMovieDataChunks = m_movieDataChunks;
    } catch (const std::bad_alloc&) {
        return eTqovixErrorOutOfMemory;
    }
    result = m_atomControl.Update(CTqovixTCTGAtomVisitor());
    return TqovixFailed(result) ? result : eTqovixSuccess;
}

eTqovixErrorCode CTqovixMovControl::WriteMediaDataHeader(const TqovixAtomList& atoms)
{
    // One mdat for all media, whatever the source had, behind every other leading atom.
    for (const auto& atom : atoms) {
        const eTqovixAtomType type = atom->GetType();
        if (type != TqovixAtom::kMdat && type != TqovixAtom::kMoov) {
            const eTqovixErrorCode result = atom->Write(m_destinationFile);
            if (TqovixFailed(result)) {
                return result;
            }
        }
    }
    uint8_t header[16] = {};
    unsigned int headerSize = 8;
    unsigned int sizeField = 0;
    if (m_bLargeMediaDataHeader) {
        TqovixWriteBE32(header, 1);
        std::memcpy(header + 4, "mdat", 4);
        headerSize = 16;
        sizeField = 8;
    } else {
        std::memcpy(header + 4, "mdat", 4);
    }
    long long position = 0;
    eTqovixErrorCode result = m_destinationFile.GetPosition(&position);
    if (TqovixFailed(result)) {
        return result;
    }
    m_mediaDataSizePosition = position + sizeField;
    return m_destinationFile.Write(header, headerSize);
}

eTqovixErrorCode CTqovixMovControl::SetMovieDataInformation(const void* afInformation, unsigned long size)
{
    if (m_bHeaderPending) {
        return eTqovixErrorInternal;
    }
    eTqovixErrorCode result = eTqovixSuccess;
    if (!IsMediaDataComplete()) {
        if (!m_bPCM) {
            return eTqovixErrorInternal;
        }
        result = CopySourceSoundTail();
        if (TqovixFailed(result)) {
            return result;
        }
    }
    result = RewriteTables(afInformation, size);
    if (TqovixFailed(result)) {
        return result;
    }
    result = WriteMovieAtom();
    if (TqovixFailed(result)) {
        return result;
    }
    // A patched copy kept the source's mdat, whose size the chunks fill exactly.
    result = m_bPatching ? eTqovixSuccess : WriteMediaDataSize();
    if (TqovixFailed(result)) {
        return result;
    }
    // Buffered bytes that a full disk refuses only show up here.
    result = m_destinationFile.Flush();
    if (TqovixFailed(result)) {
        return result;
    }
    m_bDestinationComplete = true;
    return eTqovixSuccess;
}

eTqovixErrorCode CTqovixMovControl::WriteMovieAtom()
{
    TqovixAtomList atoms;
    eTqovixErrorCode result = m_atomControl.GetAtoms(atoms);
    if (TqovixFailed(result)) {
        return result;
    }
    if (m_bPatching) {
        // Over the copy's moov, and the file ends where the new one does.
        result = m_copy.Join(m_keepGoing);
        if (TqovixFailed(result)) {
            return result;
        }
        result = m_destinationFile.Seek(static_cast<long long>(m_moovOffset), CTqovixFile::eTqovixSeekBegin);
        if (TqovixFailed(result)) {
            return result;
        }
    }
    uint64_t end = m_moovOffset;
    for (const auto& atom : atoms) {
        if (atom->GetType() == TqovixAtom::kMoov) {
            result = atom->Write(m_destinationFile);
            if (TqovixFailed(result)) {
                return result;
            }
            end += atom->GetSize();
        }
    }
    if (m_bPatchStopped) {
        // Laid out anew after a chunk, the media may end before the copy did.
        long long position = 0;
        result = m_destinationFile.GetPosition(&position);
        return TqovixFailed(result) ? result : m_destinationFile.SetFileSize(position);
    }
    return m_bPatching ? m_destinationFile.SetFileSize(static_cast<long long>(end)) : eTqovixSuccess;
}

eTqovixErrorCode CTqovixMovControl::RewriteTables(const void* afInformation, unsigned long size)
{
    // One update walk gives every moved track its new offsets, the sound track its sizes too.
    CTqovixTrackListVisitor tracks;
    tracks.SetTrackChunks(m_soundTrackIndex, m_outputAudioChunks, true);
    try {
        for (const auto& [index, count] : m_carriedTracks) {
            std::vector<TqovixChunkInformation> chunks(count);
            for (size_t k = 0; k < m_outputMovieDataChunks.size(); ++k) {
                const TqovixChunkInformation& chunk = m_outputMovieDataChunks[k];
                if (m_movieDataChunkTracks[k] == index && chunk.chunkNumber >= 1 && chunk.chunkNumber <= count) {
                    chunks[chunk.chunkNumber - 1] = chunk;
                }
            }
            tracks.SetTrackChunks(index, chunks, false);
        }
    } catch (const std::bad_alloc&) {
        return eTqovixErrorOutOfMemory;
    }
    eTqovixErrorCode result = m_atomControl.Update(tracks);
    if (TqovixFailed(result)) {
        return result;
    }
    CTqovixAFInformationVisitor af;
    af.SetAFInformation(afInformation, size);
    result = m_atomControl.Update(af);
    if (TqovixFailed(result)) {
        return result;
    }
    if (!m_audioLevelInformation.empty()) {
        CTqovixAudioLevelInformationVisitor level;
        level.SetAudioLevelInformation(m_audioLevelInformation.data(), m_audioLevelInformation.size());
        result = m_atomControl.Update(level);
        if (TqovixFailed(result)) {
            return result;
        }
    }
    return eTqovixSuccess;
}

eTqovixErrorCode CTqovixMovControl::WriteMediaDataSize()
{
    uint8_t field[8];
    unsigned int fieldSize = 4;
    if (m_bLargeMediaDataHeader) {
        TqovixWriteBE64(field, m_mediaDataSize + 16);
        fieldSize = 8;
    } else if (m_mediaDataSize + 8 > kMax32) {
        // An 8-byte header was written; a size that does not fit it would make a broken file.
        return eTqovixErrorInternal;
    } else {
        TqovixWriteBE32(field, static_cast<uint32_t>(m_mediaDataSize + 8));
    }
    m_mediaDataSize += fieldSize == 8 ? 16 : 8;
    eTqovixErrorCode result = m_destinationFile.Seek(m_mediaDataSizePosition, CTqovixFile::eTqovixSeekBegin);
    if (TqovixFailed(result)) {
        return result;
    }
    result = m_destinationFile.Write(field, fieldSize);
    if (TqovixFailed(result)) {
        return result;
    }
    return m_destinationFile.Seek(0, CTqovixFile::eTqovixSeekEnd);
}

// The movie controller copying, then patching: when the general writer would give the
// source's own layout back, the destination starts as a kernel copy of the source (shared
// extents where the file system has them) and only what changed is written over it.
#include <algorithm>
#include <atomic>
#include <cstring>
#include <new>

#include "atom/CTqovixAtom.h"
#include "atom/TqovixEndian.h"
#include "movie/CTqovixMovControl.h"

namespace {

constexpr uint64_t kComparePiece = 1 << 20;
constexpr unsigned long long kFirstCopy = 64 << 10;
// A processing library that pulls this far ahead of what it hands back is compared with the
// file instead: the served sound is not held without bound. Ours holds up to its 32 MiB
// look-ahead (24-bit 96 kHz stereo fills 7 MiB of it) and a block or two more.
constexpr uint64_t kMaxServedBytes = 33 << 20;

std::atomic<bool> g_bPatchWriting{true};
std::atomic<uint64_t> g_maxServedBytes{kMaxServedBytes};

}  // namespace

void CTqovixMovControl::SetPatchWriting(bool enabled) { g_bPatchWriting = enabled; }

void CTqovixMovControl::SetServedSoundLimit(uint64_t bytes) { g_maxServedBytes = bytes != 0 ? bytes : kMaxServedBytes; }

bool CTqovixMovControl::CanPatch(const TqovixAtomList& atoms, uint64_t& moovOffset) const
{
    // Leading atoms, then the one mdat, then the moov, ending the file; AAC chunks small enough to
    // be held while their packets are filled out.
    if ((!m_bPCM && !m_bGatherAacChunks) || atoms.size() < 2 || atoms.back()->GetType() != TqovixAtom::kMoov ||
        atoms[atoms.size() - 2]->GetType() != TqovixAtom::kMdat) {
        return false;
    }
    uint64_t mdatOffset = 0;
    for (size_t k = 0; k + 2 < atoms.size(); ++k) {
        const eTqovixAtomType type = atoms[k]->GetType();
        if (type == TqovixAtom::kMdat || type == TqovixAtom::kMoov) {
            return false;
        }
        mdatOffset += atoms[k]->GetSize();
    }
    const CTqovixAtom& mdat = *atoms[atoms.size() - 2];
    const uint64_t headerSize = mdat.GetSize() - mdat.GetDataSize();
    if ((headerSize == 16) != m_bLargeMediaDataHeader) {
        return false;
    }
    // The chunks must fill the mdat in the very order the general writer puts them in.
    uint64_t position = mdatOffset + headerSize;
    size_t v = 0;
    const auto take = [&](const TqovixChunkInformation& chunk) {
        const bool inPlace = chunk.size != 0 && chunk.offset == position;
        position += chunk.size;
        return inPlace;
    };
    for (const TqovixChunkInformation& sound : m_audioChunks) {
        for (; v < m_movieDataChunks.size() && m_movieDataChunks[v].offset < sound.offset; ++v) {
            if (!take(m_movieDataChunks[v])) {
                return false;
            }
        }
        if (!take(sound)) {
            return false;
        }
    }
    for (; v < m_movieDataChunks.size(); ++v) {
        if (!take(m_movieDataChunks[v])) {
            return false;
        }
    }
    moovOffset = mdatOffset + mdat.GetSize();
    return position == moovOffset;
}

eTqovixErrorCode CTqovixMovControl::BeginPatching(bool& started)
{
    started = false;
    TqovixAtomList atoms;
    eTqovixErrorCode result = m_atomControl.GetAtoms(atoms);
    uint64_t moovOffset = 0;
    if (TqovixFailed(result) || !g_bPatchWriting || !m_bPatchCandidate || !CanPatch(atoms, moovOffset)) {
        m_bPatchCandidate = false;
        m_servedSound.Clear();
        return result;
    }
    long long size = 0;
    result = m_sourceFile.GetFileSize(&size);
    if (!TqovixFailed(result)) {
        result = m_sourceFile.Seek(0, CTqovixFile::eTqovixSeekBegin);
    }
    // The first piece here: where the kernel cannot copy between the two files, the general
    // writer starts afresh before anything is decided.
    const auto total = static_cast<unsigned long long>(size);
    const unsigned long long first = std::min<unsigned long long>(total, kFirstCopy);
    bool copied = false;
    if (!TqovixFailed(result)) {
        // Where the copy shares extents, a patch should unshare only the blocks it writes.
        m_destinationFile.HintSmallCopyOnWrite();
        result = m_destinationFile.CopyRange(m_sourceFile, 0, 0, first, &copied, nullptr);
    }
    if (TqovixFailed(result) || !copied) {
        m_bPatchCandidate = false;
        m_servedSound.Clear();
        return result;
    }
    m_bPatching = true;
    m_moovOffset = moovOffset;
    for (size_t k = 0; k + 2 < atoms.size(); ++k) {
        m_mediaDataStart += atoms[k]->GetSize();
    }
    const CTqovixAtom& mdat = *atoms[atoms.size() - 2];
    m_sourceSizePosition = static_cast<int64_t>(m_mediaDataStart) + (m_bLargeMediaDataHeader ? 8 : 0);
    m_mediaDataStart += mdat.GetSize() - mdat.GetDataSize();
    m_outputMovieDataChunkIndex = m_movieDataChunks.size();
    started = true;
    // The rest beside the sound processing: the two take different cores.
    m_copy.Start(m_destinationFile, m_sourceFile, first, total);
    return eTqovixSuccess;
}

eTqovixErrorCode CTqovixMovControl::PatchBytes(uint64_t at, const uint8_t* data, uint32_t size)
{
    // The copy must never write over them: claimed first, they are passed over.
    eTqovixErrorCode result = m_copy.Claim(at, size);
    // Runs of changed sound go out through the stream's buffer: a seek would flush it.
    if (!TqovixFailed(result) && m_patchEnd != at) {
        result = m_destinationFile.Seek(static_cast<long long>(at), CTqovixFile::eTqovixSeekBegin);
    }
    if (!TqovixFailed(result)) {
        result = m_destinationFile.Write(data, size);
    }
    m_patchEnd = TqovixFailed(result) ? UINT64_MAX : at + size;
    return result;
}

eTqovixErrorCode CTqovixMovControl::StopPatchingAt(const TqovixChunkInformation& chunk)
{
    // Everything before the chunk stays where the copy put it; from the chunk on, media is laid
    // out in order over what the copy would have brought, which it need not bring any more.
    eTqovixErrorCode result = m_copy.JoinUpTo(chunk.offset, m_keepGoing);
    if (!TqovixFailed(result)) {
        result = m_destinationFile.Seek(static_cast<long long>(chunk.offset), CTqovixFile::eTqovixSeekBegin);
    }
    if (TqovixFailed(result)) {
        return result;
    }
    m_bPatching = false;
    m_bPatchStopped = true;
    m_patchEnd = UINT64_MAX;
    m_mediaDataSizePosition = m_sourceSizePosition;
    m_mediaDataSize = chunk.offset - m_mediaDataStart;
    m_outputMovieDataChunkIndex = 0;
    while (m_outputMovieDataChunkIndex < m_movieDataChunks.size() &&
           m_movieDataChunks[m_outputMovieDataChunkIndex].offset < chunk.offset) {
        ++m_outputMovieDataChunkIndex;
    }
    m_samplesInOutputChunk = 0;
    return eTqovixSuccess;
}

double CTqovixMovControl::GetCopyFraction()
{
    uint64_t done = 0;
    uint64_t total = 0;
    if (m_bPatching) {
        m_copy.GetProgress(done, total);
    }
    return total == 0 ? 1.0 : static_cast<double>(done) / static_cast<double>(total);
}

void CTqovixMovControl::KeepServedSound(eTqovixErrorCode served, const void* buffer,
                                        const unsigned long* delivered) const
{
    // AAC's splicer keeps its own.
    if (!m_bPCM || !m_bPatchCandidate || m_bServedOverflow || TqovixFailed(served) || delivered == nullptr ||
        *delivered == 0) {
        return;
    }
    if (m_servedSound.Size() + *delivered > g_maxServedBytes ||
        TqovixFailed(m_servedSound.Push(buffer, *delivered))) {
        m_bServedOverflow = true;
        m_servedSound.Clear();
    }
}

eTqovixErrorCode CTqovixMovControl::TakeServedSound(uint64_t offset, uint32_t size, bool swapped)
{
    if (!m_bServedOverflow && m_servedSound.Size() >= size) {
        m_servedSound.Pop(m_compareBuffer.data(), size);
        return eTqovixSuccess;
    }
    // What was served is gone (or was never kept): the source's bytes, in the served byte order.
    m_bServedOverflow = true;
    m_servedSound.Clear();
    unsigned int got = 0;
    const eTqovixErrorCode result = m_sourceFile.ReadAt(offset, m_compareBuffer.data(), size, &got);
    if (TqovixFailed(result)) {
        return result;
    }
    if (got != size) {
        return eTqovixErrorInternal;  // the tables were checked against the file: it shrank
    }
    if (swapped) {
        TqovixSwapSamples(m_compareBuffer.data(), size, m_sampleBytes);
    }
    return eTqovixSuccess;
}

eTqovixErrorCode CTqovixMovControl::PatchSound(uint64_t offset, const uint8_t* data, uint32_t size, bool swap)
{
    // Whole samples a piece, so that a changed sample is never cut in two.
    const uint32_t width = m_sampleBytes;
    const uint64_t limit = kComparePiece - kComparePiece % width;
    try {
        const uint64_t piece = std::min<uint64_t>(std::max<uint32_t>(size, width), limit);
        m_copyBuffer.resize(std::max<uint64_t>(m_copyBuffer.size(), piece));
        m_compareBuffer.resize(std::max<uint64_t>(m_compareBuffer.size(), piece));
    } catch (const std::bad_alloc&) {
        return eTqovixErrorOutOfMemory;
    }
    for (uint32_t done = 0; done < size;) {
        const auto piece = static_cast<unsigned int>(std::min<uint64_t>(size - done, limit));
        eTqovixErrorCode result = TakeServedSound(offset + done, piece, swap);
        if (TqovixFailed(result)) {
            return result;
        }
        // Unchanged sound stays as copied, so the blocks it shares with the source stay shared:
        // only the samples from the first changed one to the last are written.
        const uint8_t* served = m_compareBuffer.data();
        const uint8_t* processed = data + done;
        if (std::memcmp(served, processed, piece) != 0) {
            const auto mismatch = std::mismatch(served, served + piece, processed);
            uint32_t last = piece;
            while (last > 0 && served[last - 1] == processed[last - 1]) {
                --last;
            }
            const auto first = static_cast<uint32_t>(mismatch.first - served) / width * width;
            last = (last + width - 1) / width * width;
            const uint32_t count = last - first;
            const uint64_t at = offset + done + first;
            const uint8_t* bytes = processed + first;
            if (swap) {
                std::memcpy(m_copyBuffer.data(), bytes, count);
                TqovixSwapSamples(m_copyBuffer.data(), count, width);
                bytes = m_copyBuffer.data();
            }
            result = PatchBytes(at, bytes, count);
            if (TqovixFailed(result)) {
                return result;
            }
        }
        done += piece;
    }
    return eTqovixSuccess;
}

// The movie controller copying, then patching: when the general writer would give the
// source's own layout back, the destination starts as a kernel copy of the source (shared
// extents where the file system has them) and only what changed is written over it.
#include <algorithm>
#include <atomic>
#include <cstring>
#include <new>

#include "atom/CTqovixAtom.h"
#include "movie/CTqovixMovControl.h"

namespace {

constexpr uint64_t kComparePiece = 1 << 20;

std::atomic<bool> g_bPatchWriting{true};

void SwapPairs(uint8_t* bytes, uint64_t size)
{
    for (uint64_t k = 0; k + 1 < size; k += 2) {
        std::swap(bytes[k], bytes[k + 1]);
    }
}

}  // namespace

void CTqovixMovControl::SetPatchWriting(bool enabled) { g_bPatchWriting = enabled; }

bool CTqovixMovControl::CanPatch(const TqovixAtomList& atoms, uint64_t& moovOffset) const
{
    // Leading atoms, then the one mdat, then the moov, ending the file.
    if (!m_bPCM || atoms.size() < 2 || atoms.back()->GetType() != TqovixAtom::kMoov ||
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
    if (TqovixFailed(result) || !g_bPatchWriting || !CanPatch(atoms, moovOffset)) {
        return result;
    }
    long long size = 0;
    result = m_sourceFile.GetFileSize(&size);
    if (!TqovixFailed(result)) {
        result = m_sourceFile.Seek(0, CTqovixFile::eTqovixSeekBegin);
    }
    bool copied = false;
    if (!TqovixFailed(result)) {
        result = m_destinationFile.CopyFrom(m_sourceFile, static_cast<unsigned long long>(size), &copied);
    }
    // Where the kernel cannot copy between the two files, the general writer starts afresh.
    if (TqovixFailed(result) || !copied) {
        return result;
    }
    m_bPatching = true;
    m_moovOffset = moovOffset;
    m_outputMovieDataChunkIndex = m_movieDataChunks.size();
    started = true;
    return eTqovixSuccess;
}

eTqovixErrorCode CTqovixMovControl::PatchSound(uint64_t offset, const uint8_t* data, uint32_t size, bool swap)
{
    try {
        const uint64_t piece = std::min<uint64_t>(std::max<uint32_t>(size, 2), kComparePiece);
        m_copyBuffer.resize(std::max<uint64_t>(m_copyBuffer.size(), piece));
        m_compareBuffer.resize(std::max<uint64_t>(m_compareBuffer.size(), piece));
    } catch (const std::bad_alloc&) {
        return eTqovixErrorOutOfMemory;
    }
    for (uint32_t done = 0; done < size;) {
        const auto piece = static_cast<unsigned int>(std::min<uint64_t>(size - done, m_copyBuffer.size()));
        const uint8_t* bytes = data + done;
        if (swap) {
            std::memcpy(m_copyBuffer.data(), bytes, piece);
            SwapPairs(m_copyBuffer.data(), piece);
            bytes = m_copyBuffer.data();
        }
        unsigned int got = 0;
        eTqovixErrorCode result = m_sourceFile.ReadAt(offset + done, m_compareBuffer.data(), piece, &got);
        if (TqovixFailed(result)) {
            return result;
        }
        // Unchanged sound stays as copied, so the blocks it shares with the source stay shared.
        if (got != piece || std::memcmp(m_compareBuffer.data(), bytes, piece) != 0) {
            result = m_destinationFile.Seek(static_cast<long long>(offset + done), CTqovixFile::eTqovixSeekBegin);
            if (!TqovixFailed(result)) {
                result = m_destinationFile.Write(bytes, piece);
            }
            if (TqovixFailed(result)) {
                return result;
            }
        }
        done += piece;
    }
    return eTqovixSuccess;
}

// The movie controller moving media: new sound chunks written as the processing
// library hands sound back, and every carried chunk copied in source order around them.
#include <algorithm>
#include <cstring>
#include <new>

#include "atom/CTqovixAtom.h"
#include "atom/TqovixEndian.h"
#include "engine/CTqovixMainFrame.h"
#include "codec/TqovixAacSyntax.h"
#include "movie/CTqovixMovControl.h"

namespace {

// Video chunks and swapped PCM move through one reused buffer of at most this size,
// so memory stays flat whatever the chunk sizes.
constexpr uint64_t kCopyPiece = 1 << 20;
// Carried chunks larger than this are copied in pieces with a look at whether to go on between.
constexpr uint64_t kStopPiece = 64 << 20;
constexpr uint64_t kMax32 = CTqovixAtom::kMaxCompactAtomSize;

}  // namespace

eTqovixErrorCode CTqovixMovControl::SetMovieMetaData(const void* data, unsigned long size)
{
    if (m_bHeaderPending) {
        m_bHeaderPending = false;
        const eTqovixErrorCode result = WriteLeadingAtoms();
        if (TqovixFailed(result)) {
            return result;
        }
    }
    if (!m_bPCM) {
        if (TqovixFailed(m_encodeResult)) {
            return m_encodeResult;
        }
        const eTqovixErrorCode result = m_audioDataControl.PushAudioData(data, size);
        // The movie is finished as PCM's is, when the library reports its end: a stop asked
        // before that still stops the job, and the wait for a copy is seen as such.
        return TqovixFailed(result) || TqovixFailed(m_encodeResult) ? (TqovixFailed(result) ? result : m_encodeResult)
                                                                   : result;
    }
    if (size != 0 && data == nullptr) {
        return eTqovixErrorInternal;
    }
    const auto* bytes = static_cast<const uint8_t*>(data);
    if (m_bBigEndian && size != 0) {
        // Only whole samples can be swapped: the start of one waits for the rest.
        const uint32_t width = m_sampleBytes;
        if (m_carriedBytes != 0) {
            const auto take = static_cast<uint32_t>(std::min<uint64_t>(width - m_carriedBytes, size));
            std::memcpy(m_carried + m_carriedBytes, bytes, take);
            m_carriedBytes += take;
            bytes += take;
            size -= take;
            if (m_carriedBytes == width) {
                m_carriedBytes = 0;
                const eTqovixErrorCode result = WritePcm(m_carried, width, true);
                if (TqovixFailed(result)) {
                    return result;
                }
            }
        }
        const auto rest = static_cast<uint32_t>(size % width);
        if (rest != 0) {
            std::memcpy(m_carried + m_carriedBytes, bytes + size - rest, rest);
            m_carriedBytes += rest;
            size -= rest;
        }
    }
    return WritePcm(bytes, size, m_bBigEndian);
}

eTqovixErrorCode CTqovixMovControl::WriteMetaData(const void* data, unsigned long size)
{
    if (m_bPCM) {
        return WritePcm(static_cast<const uint8_t*>(data), size, m_bBigEndian);
    }
    return WriteAacPacket(static_cast<const uint8_t*>(data), size);
}

eTqovixErrorCode CTqovixMovControl::BeginAacPacket(TqovixChunkInformation*& output)
{
    const eTqovixErrorCode result = CopyPrecedingVideo();
    if (TqovixFailed(result)) {
        return result;
    }
    const uint64_t a = m_outputAudioChunkIndex;
    try {
        if (a >= m_outputAudioChunks.size()) {
            m_outputAudioChunks.resize(a + 1);
        }
    } catch (const std::bad_alloc&) {
        return eTqovixErrorOutOfMemory;
    }
    output = &m_outputAudioChunks[a];
    if (m_samplesInOutputChunk == 0) {
        long long position = 0;
        const eTqovixErrorCode found = m_destinationFile.GetPosition(&position);
        if (TqovixFailed(found)) {
            return found;
        }
        output->size = 0;
        output->offset = static_cast<uint64_t>(position);
        output->sampleSizes.clear();
        m_sourceBytesInChunk = 0;
    }
    return eTqovixSuccess;
}

void CTqovixMovControl::EndAacPackets(uint64_t count)
{
    const uint64_t a = m_outputAudioChunkIndex;
    const TqovixChunkInformation& source = m_audioChunks[a];
    m_samplesInOutputChunk += static_cast<uint32_t>(count);
    if (m_samplesInOutputChunk >= source.sampleCount) {
        m_outputAudioChunks[a].chunkNumber = source.chunkNumber;
        m_outputAudioChunks[a].sampleCount = source.sampleCount;
        m_samplesInOutputChunk = 0;
        m_outputAudioChunkIndex = a + 1;
        m_audioDataControl.SetOutputChunkIndex(m_outputAudioChunkIndex);
    }
}

eTqovixErrorCode CTqovixMovControl::WriteAacPacket(const uint8_t* packet, unsigned long size)
{
    const uint64_t count = m_audioChunks.size();
    if (m_outputAudioChunkIndex >= count) {
        return eTqovixFinished;
    }
    if (packet == nullptr || size == 0 || size > kMax32) {
        return eTqovixErrorInternal;
    }
    TqovixChunkInformation* output = nullptr;
    eTqovixErrorCode result = BeginAacPacket(output);
    if (TqovixFailed(result)) {
        return result;
    }
    const TqovixChunkInformation& source = m_audioChunks[m_outputAudioChunkIndex];
    if (uint64_t{output->size} + size > kMax32 || m_samplesInOutputChunk >= source.sampleSizes.size()) {
        return eTqovixErrorInternal;
    }
    try {
        output->sampleSizes.push_back(static_cast<uint32_t>(size));
    } catch (const std::bad_alloc&) {
        return eTqovixErrorOutOfMemory;
    }
    result = m_destinationFile.Write(packet, static_cast<unsigned int>(size));
    if (TqovixFailed(result)) {
        return result;
    }
    output->size += static_cast<uint32_t>(size);
    m_mediaDataSize += size;
    m_sourceBytesInChunk += source.sampleSizes[m_samplesInOutputChunk];
    EndAacPackets(1);
    if (m_outputAudioChunkIndex >= count) {
        result = CopyRemainingVideo();
        return TqovixFailed(result) ? result : eTqovixSuccess;
    }
    return eTqovixRunning;
}

eTqovixErrorCode CTqovixMovControl::CarryAacPackets(uint64_t count)
{
    eTqovixErrorCode result = eTqovixRunning;
    while (count != 0 && !TqovixFailed(result)) {
        if (m_outputAudioChunkIndex >= m_audioChunks.size()) {
            return eTqovixErrorInternal;  // more packets than the track holds
        }
        TqovixChunkInformation* output = nullptr;
        result = BeginAacPacket(output);
        if (TqovixFailed(result)) {
            break;
        }
        const TqovixChunkInformation& source = m_audioChunks[m_outputAudioChunkIndex];
        const uint64_t first = m_samplesInOutputChunk;
        const uint64_t n = std::min<uint64_t>(count, source.sampleCount - first);
        if (first + n > source.sampleSizes.size()) {
            return eTqovixErrorInternal;
        }
        uint64_t bytes = 0;
        for (uint64_t k = first; k < first + n; ++k) {
            bytes += source.sampleSizes[k];
        }
        if (uint64_t{output->size} + bytes > kMax32) {
            return eTqovixErrorInternal;
        }
        // A run of the source's packets lies in one piece: the kernel copies it.
        result = m_sourceFile.Seek(static_cast<long long>(source.offset + m_sourceBytesInChunk),
                                   CTqovixFile::eTqovixSeekBegin);
        bool copied = false;
        if (!TqovixFailed(result) && bytes != 0) {
            result = m_destinationFile.CopyFrom(m_sourceFile, bytes, &copied);
            if (!TqovixFailed(result) && !copied) {
                result = CopyThroughBuffer(static_cast<uint32_t>(bytes));
            }
        }
        if (TqovixFailed(result)) {
            break;
        }
        try {
            output->sampleSizes.insert(output->sampleSizes.end(), source.sampleSizes.begin() + static_cast<std::ptrdiff_t>(first),
                                       source.sampleSizes.begin() + static_cast<std::ptrdiff_t>(first + n));
        } catch (const std::bad_alloc&) {
            return eTqovixErrorOutOfMemory;
        }
        output->size += static_cast<uint32_t>(bytes);
        m_mediaDataSize += bytes;
        m_sourceBytesInChunk += bytes;
        count -= n;
        EndAacPackets(n);
        result = eTqovixRunning;
    }
    if (!TqovixFailed(result) && m_outputAudioChunkIndex >= m_audioChunks.size()) {
        result = CopyRemainingVideo();
        result = TqovixFailed(result) ? result : eTqovixSuccess;
    }
    return result;
}

eTqovixErrorCode CTqovixMovControl::CarrySourcePackets(uint64_t count)
{
    if (!m_bGatherAacChunks) {
        return NotePacketResult(CarryAacPackets(count));
    }
    eTqovixErrorCode result = eTqovixRunning;
    while (count != 0 && !TqovixFailed(result)) {
        if (m_outputAudioChunkIndex >= m_audioChunks.size()) {
            return NotePacketResult(eTqovixErrorInternal);
        }
        const TqovixChunkInformation& source = m_audioChunks[m_outputAudioChunkIndex];
        const uint64_t n = std::min<uint64_t>(count, source.sampleCount - m_aacGathered);
        if (m_aacGathered + n > source.sampleSizes.size()) {
            return NotePacketResult(eTqovixErrorInternal);
        }
        uint64_t bytes = 0;
        for (uint64_t k = m_aacGathered; k < m_aacGathered + n; ++k) {
            bytes += source.sampleSizes[k];
        }
        try {
            if (m_aacRuns.empty() || m_aacRuns.back().encoded) {
                m_aacRuns.emplace_back();
            }
        } catch (const std::bad_alloc&) {
            return NotePacketResult(eTqovixErrorOutOfMemory);
        }
        m_aacRuns.back().count += static_cast<uint32_t>(n);
        m_aacRuns.back().sourceBytes += bytes;
        m_aacGathered += static_cast<uint32_t>(n);
        count -= n;
        result = m_aacGathered == source.sampleCount ? LayOutAacChunk() : eTqovixRunning;
    }
    return NotePacketResult(result);
}

eTqovixErrorCode CTqovixMovControl::WriteEncodedPacket(const uint8_t* packet, uint32_t size)
{
    if (!m_bGatherAacChunks) {
        const eTqovixErrorCode result = WriteAacPacket(packet, size);
        // More packets than the track holds is the splicer's mistake, not a finished movie.
        return NotePacketResult(result == eTqovixFinished ? eTqovixErrorInternal : result);
    }
    if (m_outputAudioChunkIndex >= m_audioChunks.size() || packet == nullptr || size == 0) {
        return NotePacketResult(eTqovixErrorInternal);
    }
    const TqovixChunkInformation& source = m_audioChunks[m_outputAudioChunkIndex];
    if (m_aacGathered >= source.sampleSizes.size()) {
        return NotePacketResult(eTqovixErrorInternal);
    }
    try {
        if (m_aacRuns.empty() || !m_aacRuns.back().encoded) {
            m_aacRuns.emplace_back();
            m_aacRuns.back().encoded = true;
        }
        AacRun& run = m_aacRuns.back();
        run.bytes.insert(run.bytes.end(), packet, packet + size);
        run.sizes.push_back(size);
        ++run.count;
        run.sourceBytes += source.sampleSizes[m_aacGathered];
    } catch (const std::bad_alloc&) {
        return NotePacketResult(eTqovixErrorOutOfMemory);
    }
    ++m_aacGathered;
    return NotePacketResult(m_aacGathered == source.sampleCount ? LayOutAacChunk() : eTqovixRunning);
}

eTqovixErrorCode CTqovixMovControl::LayOutAacChunk()
{
    const TqovixChunkInformation& source = m_audioChunks[m_outputAudioChunkIndex];
    bool encoded = false;
    uint64_t total = 0;
    bool runsFit = true;
    for (const AacRun& run : m_aacRuns) {
        encoded = encoded || run.encoded;
        total += run.encoded ? run.bytes.size() : run.sourceBytes;
        runsFit = runsFit && (!run.encoded || run.bytes.size() <= run.sourceBytes);
    }
    // Re-encoded packets take the bytes of the ones they replace where they fit, filled out in
    // each run's last packet; else the chunk's bytes, filled out in its last re-encoded packet;
    // else the chunk grows, and what follows it moves.
    bool sameSize = encoded && (runsFit || total <= source.size);
    std::vector<uint8_t> padded;
    for (size_t r = m_aacRuns.size(); sameSize && r-- > 0;) {
        AacRun& run = m_aacRuns[r];
        if (!run.encoded || (!runsFit && total == source.size)) {
            continue;
        }
        const uint64_t grow = runsFit ? run.sourceBytes - run.bytes.size() : source.size - total;
        const uint32_t last = run.sizes.back();
        const size_t at = run.bytes.size() - last;
        if (grow + last > UINT32_MAX ||
            !TqovixAacSyntax::PadToSize(run.bytes.data() + at, last, last + grow, padded)) {
            sameSize = false;
            break;
        }
        try {
            run.bytes.resize(at);
            run.bytes.insert(run.bytes.end(), padded.begin(), padded.end());
        } catch (const std::bad_alloc&) {
            return eTqovixErrorOutOfMemory;
        }
        run.sizes.back() = static_cast<uint32_t>(padded.size());
        total += grow;
        if (!runsFit) {
            break;  // the chunk's bytes are filled out in one packet
        }
    }
    eTqovixErrorCode result = eTqovixSuccess;
    if (!m_bPatching || (encoded && !sameSize)) {
        result = m_bPatching ? StopPatchingAt(source) : eTqovixSuccess;
        if (!TqovixFailed(result)) {
            result = WriteAacChunkInOrder();
        }
    } else {
        // Over the copy: only what differs from it, the runs where each kept its bytes, else the chunk.
        TqovixChunkInformation& output = m_outputAudioChunks[m_outputAudioChunkIndex];
        try {
            output.sampleSizes.clear();
            std::vector<uint8_t> whole;
            uint64_t offset = source.offset;
            uint32_t packet = 0;
            for (const AacRun& run : m_aacRuns) {
                if (run.encoded) {
                    output.sampleSizes.insert(output.sampleSizes.end(), run.sizes.begin(), run.sizes.end());
                } else {
                    output.sampleSizes.insert(output.sampleSizes.end(), source.sampleSizes.begin() + packet,
                                              source.sampleSizes.begin() + packet + run.count);
                }
                if (runsFit && run.encoded) {
                    result = PatchBytes(offset, run.bytes.data(), static_cast<uint32_t>(run.bytes.size()));
                } else if (!runsFit && run.encoded) {
                    whole.insert(whole.end(), run.bytes.begin(), run.bytes.end());
                } else if (!runsFit) {
                    // The source's packets move within the chunk.
                    const size_t at = whole.size();
                    whole.resize(at + run.sourceBytes);
                    unsigned int got = 0;
                    result = m_sourceFile.ReadAt(offset, whole.data() + at, static_cast<unsigned int>(run.sourceBytes), &got);
                    result = TqovixFailed(result) || got == run.sourceBytes ? result : eTqovixErrorInternal;
                }
                if (TqovixFailed(result)) {
                    return result;
                }
                offset += run.sourceBytes;
                packet += run.count;
            }
            if (!runsFit && encoded) {
                result = PatchBytes(source.offset, whole.data(), static_cast<uint32_t>(whole.size()));
            }
        } catch (const std::bad_alloc&) {
            return eTqovixErrorOutOfMemory;
        }
        if (!TqovixFailed(result)) {
            m_samplesInOutputChunk = 0;
            EndAacPackets(source.sampleCount);
        }
    }
    m_aacRuns.clear();
    m_aacGathered = 0;
    if (TqovixFailed(result) || m_outputAudioChunkIndex < m_audioChunks.size()) {
        return TqovixFailed(result) ? result : eTqovixRunning;
    }
    result = m_bPatching ? eTqovixSuccess : CopyRemainingVideo();
    return TqovixFailed(result) ? result : eTqovixSuccess;
}

eTqovixErrorCode CTqovixMovControl::WriteAacChunkInOrder()
{
    eTqovixErrorCode result = eTqovixRunning;
    for (const AacRun& run : m_aacRuns) {
        if (!run.encoded) {
            result = CarryAacPackets(run.count);
        }
        for (size_t k = 0, at = 0; run.encoded && k < run.sizes.size() && !TqovixFailed(result); at += run.sizes[k++]) {
            result = WriteAacPacket(run.bytes.data() + at, run.sizes[k]);
        }
        if (TqovixFailed(result)) {
            return result;
        }
    }
    return result;
}

eTqovixErrorCode CTqovixMovControl::NotePacketResult(eTqovixErrorCode result)
{
    // A failed packet must stay failed: later packets of the same push would hide it.
    if (TqovixFailed(result)) {
        m_encodeResult = TqovixFailed(m_encodeResult) ? m_encodeResult : result;
        return result;
    }
    if (result == eTqovixSuccess) {
        m_bFinishPending = true;
    }
    return eTqovixSuccess;
}

bool CTqovixMovControl::EndFits(uint64_t end, const std::vector<uint32_t>& pending) const
{
    // A span's last re-encoded packets keep their chunk's size only if they take no more than
    // the source's packets did: while they take more, the span goes on (both writers alike, so
    // that they agree), but not past its chunk, nor through a long one.
    constexpr uint64_t kMaxLongerPackets = 64;
    if (!m_bGatherAacChunks || end == 0 || m_chunkFirstPacket.size() != m_audioChunks.size() + 1 ||
        end > m_chunkFirstPacket.back() || pending.size() > end) {
        return true;
    }
    const auto after = std::upper_bound(m_chunkFirstPacket.begin(), m_chunkFirstPacket.end(), end - 1);
    const auto chunk = static_cast<size_t>(after - m_chunkFirstPacket.begin() - 1);
    const uint64_t first = m_chunkFirstPacket[chunk];
    if (end == m_chunkFirstPacket[chunk + 1] || m_audioChunks[chunk].sampleCount > kMaxLongerPackets) {
        return true;
    }
    const TqovixChunkInformation& source = m_audioChunks[chunk];
    uint64_t bytes = 0;
    uint64_t budget = 0;
    // Re-encoded packets of this chunk already handed over: the run the gathering ends with.
    const uint64_t handed = end - pending.size();
    if (chunk == m_outputAudioChunkIndex && handed > first && !m_aacRuns.empty() && m_aacRuns.back().encoded &&
        m_aacGathered == handed - first) {
        bytes += m_aacRuns.back().bytes.size();
        budget += m_aacRuns.back().sourceBytes;
    }
    for (uint64_t index = std::max(handed, first); index < end; ++index) {
        bytes += pending[index - handed];
        budget += source.sampleSizes.size() > index - first ? source.sampleSizes[index - first] : 0;
    }
    return bytes <= budget;
}

eTqovixErrorCode CTqovixMovControl::ReadSourcePacket(uint64_t index, std::vector<uint8_t>& packet)
{
    if (m_chunkFirstPacket.size() != m_audioChunks.size() + 1 || index >= m_chunkFirstPacket.back()) {
        return eTqovixErrorInternal;
    }
    const auto after = std::upper_bound(m_chunkFirstPacket.begin(), m_chunkFirstPacket.end(), index);
    const auto chunkIndex = static_cast<size_t>(after - m_chunkFirstPacket.begin() - 1);
    const TqovixChunkInformation& chunk = m_audioChunks[chunkIndex];
    const uint64_t k = index - m_chunkFirstPacket[chunkIndex];
    if (k >= chunk.sampleSizes.size()) {
        return eTqovixErrorInternal;
    }
    uint64_t offset = chunk.offset;
    for (uint64_t i = 0; i < k; ++i) {
        offset += chunk.sampleSizes[i];
    }
    const uint32_t size = chunk.sampleSizes[k];
    // What the decoder took from this packet, a moment ago, was no larger.
    if (size == 0 || size > CTqovixAudioDataControl::kReadPieceBytes) {
        return eTqovixErrorInternal;
    }
    try {
        packet.resize(size);
    } catch (const std::bad_alloc&) {
        return eTqovixErrorOutOfMemory;
    }
    unsigned int got = 0;
    const eTqovixErrorCode result = m_sourceFile.ReadAt(offset, packet.data(), size, &got);
    if (TqovixFailed(result)) {
        return result;
    }
    return got == size ? eTqovixSuccess : eTqovixErrorInternal;
}

eTqovixErrorCode CTqovixMovControl::WritePcm(const uint8_t* data, unsigned long size, bool swap)
{
    const uint64_t count = m_audioChunks.size();
    if (m_outputAudioChunkIndex >= count) {
        return eTqovixFinished;
    }
    unsigned long consumed = 0;
    while (size != 0 && m_outputAudioChunkIndex < count) {
        const TqovixChunkInformation& source = m_audioChunks[m_outputAudioChunkIndex];
        eTqovixErrorCode result = eTqovixSuccess;
        // A patched copy has every chunk in place already; the general writer lays them out.
        if (!m_bPatching) {
            result = CopyPrecedingVideo();
            if (TqovixFailed(result)) {
                return result;
            }
            if (m_bytesInOutputChunk == 0) {
                long long position = 0;
                result = m_destinationFile.GetPosition(&position);
                if (TqovixFailed(result)) {
                    return result;
                }
                m_outputAudioChunks[m_outputAudioChunkIndex].offset = static_cast<uint64_t>(position);
            }
        }
        const uint32_t need = source.size - m_bytesInOutputChunk;
        const auto n = static_cast<uint32_t>(std::min<uint64_t>(size - consumed, need));
        if (m_bPatching) {
            result = PatchSound(source.offset + m_bytesInOutputChunk, data + consumed, n, swap);
        } else {
            result = swap ? WriteSwapped(data + consumed, n) : m_destinationFile.Write(data + consumed, n);
        }
        if (TqovixFailed(result)) {
            return result;
        }
        m_bytesInOutputChunk += n;
        m_mediaDataSize += n;
        consumed += n;
        if (n == need) {
            ++m_outputAudioChunkIndex;
            m_bytesInOutputChunk = 0;
        }
        if (consumed >= size) {
            break;
        }
    }
    if (m_outputAudioChunkIndex >= count) {
        return CopyRemainingVideo();
    }
    return eTqovixSuccess;
}

eTqovixErrorCode CTqovixMovControl::WriteSwapped(const uint8_t* data, unsigned long size)
{
    // Whole samples a piece: none is cut in two by the reused buffer.
    const uint64_t limit = kCopyPiece - kCopyPiece % m_sampleBytes;
    try {
        m_copyBuffer.resize(std::min<uint64_t>(std::max<uint64_t>(size, m_sampleBytes), limit));
    } catch (const std::bad_alloc&) {
        return eTqovixErrorOutOfMemory;
    }
    for (unsigned long done = 0; done < size;) {
        const auto piece = static_cast<unsigned int>(std::min<uint64_t>(size - done, limit));
        std::memcpy(m_copyBuffer.data(), data + done, piece);
        TqovixSwapSamples(m_copyBuffer.data(), piece, m_sampleBytes);
        const eTqovixErrorCode result = m_destinationFile.Write(m_copyBuffer.data(), piece);
        if (TqovixFailed(result)) {
            return result;
        }
        done += piece;
    }
    return eTqovixSuccess;
}

eTqovixErrorCode CTqovixMovControl::CopyPrecedingVideo()
{
    const uint64_t soundOffset = m_audioChunks[m_outputAudioChunkIndex].offset;
    while (m_outputMovieDataChunkIndex < m_movieDataChunks.size() &&
           m_movieDataChunks[m_outputMovieDataChunkIndex].offset < soundOffset) {
        const eTqovixErrorCode result = WriteMovieMetaData();
        if (TqovixFailed(result)) {
            return result;
        }
    }
    return eTqovixSuccess;
}

eTqovixErrorCode CTqovixMovControl::CopyRemainingVideo()
{
    // Media after the last sound chunk may be most of a movie: a stop is looked for on the way.
    uint64_t sinceAsked = 0;
    while (m_outputMovieDataChunkIndex < m_movieDataChunks.size()) {
        sinceAsked += m_movieDataChunks[m_outputMovieDataChunkIndex].size;
        eTqovixErrorCode result = WriteMovieMetaData();
        if (!TqovixFailed(result) && sinceAsked >= kStopPiece && m_keepGoing) {
            sinceAsked = 0;
            result = m_keepGoing(m_outputMovieDataChunkIndex, m_movieDataChunks.size());
        }
        if (TqovixFailed(result)) {
            return result;
        }
    }
    return eTqovixSuccess;
}

eTqovixErrorCode CTqovixMovControl::WriteMovieMetaData()
{
    const uint64_t v = m_outputMovieDataChunkIndex;
    if (v >= m_movieDataChunks.size()) {
        return eTqovixErrorInternal;
    }
    const TqovixChunkInformation& chunk = m_movieDataChunks[v];
    long long position = 0;
    eTqovixErrorCode result = m_destinationFile.GetPosition(&position);
    if (TqovixFailed(result)) {
        return result;
    }
    result = m_sourceFile.Seek(static_cast<long long>(chunk.offset), CTqovixFile::eTqovixSeekBegin);
    if (TqovixFailed(result)) {
        return result;
    }
    // A large chunk goes in pieces, so that a stop is seen while it is copied.
    for (uint32_t done = 0; done < chunk.size;) {
        const auto piece = static_cast<uint32_t>(std::min<uint64_t>(chunk.size - done, kStopPiece));
        bool copied = false;
        result = m_destinationFile.CopyFrom(m_sourceFile, piece, &copied);
        if (!TqovixFailed(result) && !copied) {
            result = CopyThroughBuffer(piece);
        }
        done += piece;
        if (!TqovixFailed(result) && done < chunk.size && m_keepGoing) {
            result = m_keepGoing(done, chunk.size);
        }
        if (TqovixFailed(result)) {
            return result;
        }
    }
    m_outputMovieDataChunks[v].offset = static_cast<uint64_t>(position);
    m_mediaDataSize += chunk.size;
    m_outputMovieDataChunkIndex = v + 1;
    return eTqovixSuccess;
}

eTqovixErrorCode CTqovixMovControl::CopyThroughBuffer(uint32_t size)
{
    try {
        m_copyBuffer.resize(std::min<uint64_t>(std::max<uint64_t>(size, 1), kCopyPiece));
    } catch (const std::bad_alloc&) {
        return eTqovixErrorOutOfMemory;
    }
    for (uint32_t done = 0; done < size;) {
        const auto piece = static_cast<unsigned int>(std::min<uint64_t>(size - done, m_copyBuffer.size()));
        unsigned int got = 0;
        eTqovixErrorCode result = m_sourceFile.Read(m_copyBuffer.data(), &got, piece);
        if (TqovixFailed(result)) {
            return result;
        }
        // The tables were checked against the file size: a short read means the source changed.
        if (got != piece) {
            return eTqovixErrorInternal;
        }
        result = m_destinationFile.Write(m_copyBuffer.data(), got);
        if (TqovixFailed(result)) {
            return result;
        }
        done += got;
    }
    return eTqovixSuccess;
}

bool CTqovixMovControl::TakeFinishPending()
{
    const bool pending = m_bFinishPending;
    m_bFinishPending = false;
    return pending;
}

eTqovixErrorCode CTqovixMovControl::FlushEncoder()
{
    if (m_bPCM || m_bHeaderPending || IsMediaDataComplete() || TqovixFailed(m_encodeResult)) {
        return m_encodeResult;
    }
    m_audioDataControl.SetOutputChunkIndex(m_audioChunks.size());
    const eTqovixErrorCode result = m_audioDataControl.EncodeDone();
    return TqovixFailed(result) ? result : m_encodeResult;
}

bool CTqovixMovControl::IsMediaDataComplete() const
{
    return !m_bHeaderPending && m_outputAudioChunkIndex >= m_audioChunks.size() &&
           m_outputMovieDataChunkIndex >= m_movieDataChunks.size();
}

eTqovixErrorCode CTqovixMovControl::CopySourceSoundTail()
{
    // The library ended before the track did: the rest of the sound goes out unprocessed
    // rather than leaving chunks whose offsets point nowhere. A patched copy holds it already.
    if (m_bPatching) {
        m_outputAudioChunkIndex = m_audioChunks.size();
        m_bytesInOutputChunk = 0;
        return eTqovixSuccess;
    }
    std::vector<uint8_t> piece;
    try {
        piece.resize(kCopyPiece);
    } catch (const std::bad_alloc&) {
        return eTqovixErrorOutOfMemory;
    }
    m_carriedBytes = 0;
    while (m_outputAudioChunkIndex < m_audioChunks.size()) {
        const TqovixChunkInformation& chunk = m_audioChunks[m_outputAudioChunkIndex];
        const uint32_t left = chunk.size - m_bytesInOutputChunk;
        const auto wanted = static_cast<unsigned int>(std::min<uint64_t>(left, piece.size()));
        eTqovixErrorCode result = m_sourceFile.Seek(static_cast<long long>(chunk.offset + m_bytesInOutputChunk),
                                                    CTqovixFile::eTqovixSeekBegin);
        unsigned int got = 0;
        if (!TqovixFailed(result)) {
            result = m_sourceFile.Read(piece.data(), &got, wanted);
        }
        if (TqovixFailed(result)) {
            return result;
        }
        if (got != wanted) {
            return eTqovixErrorInternal;
        }
        if (wanted == 0) {
            // An empty chunk still needs its offset recorded by the writer.
            result = CopyPrecedingVideo();
            if (TqovixFailed(result)) {
                return result;
            }
            long long position = 0;
            result = m_destinationFile.GetPosition(&position);
            if (TqovixFailed(result)) {
                return result;
            }
            m_outputAudioChunks[m_outputAudioChunkIndex].offset = static_cast<uint64_t>(position);
            ++m_outputAudioChunkIndex;
            continue;
        }
        result = WritePcm(piece.data(), got, false);
        if (TqovixFailed(result)) {
            return result;
        }
    }
    return CopyRemainingVideo();
}


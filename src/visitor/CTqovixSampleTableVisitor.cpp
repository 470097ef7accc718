#include "visitor/CTqovixSampleTableVisitor.h"

#include <algorithm>

#include "atom/CTqovixLeafAtom.h"
#include "atom/TqovixEndian.h"
#include "visitor/TqovixTrackPath.h"

using namespace TqovixTrackPath;

namespace {

// Entry j lands at position j; tables only grow while reading.
template <typename T>
void Reserve(std::vector<T>& table, uint64_t entries)
{
    if (table.size() < entries) {
        table.resize(entries);
    }
}

}  // namespace

CTqovixSampleTableVisitor::CTqovixSampleTableVisitor(const char (&handlerSubtype)[5], bool emptyPathIsError)
    : m_handlerSubtype(handlerSubtype), m_bEmptyPathIsError(emptyPathIsError)
{
}

bool CTqovixSampleTableVisitor::IsNecessary(const TqovixAtomPath& path) const
{
    static const TqovixAtomPath handler = TqovixMakeAtomPath("moovtrakmdiahdlr");
    const bool isHandler = !path.empty() && path.back() == kHdlr;
    return IsWanted(path, isHandler ? handler : SampleTablePath(), {kStsc, kStsz, kStco, kCo64, kHdlr});
}

eTqovixErrorCode CTqovixSampleTableVisitor::AnswerHandler(const CTqovixLeafAtom& handler) const
{
    const eTqovixErrorCode answer = HandlerAnswer(handler, m_handlerSubtype);
    m_bTrack = answer == eTqovixVisitContinue;
    return answer;
}

eTqovixErrorCode CTqovixSampleTableVisitor::Analyze(const TqovixAtomPath& path, const CTqovixLeafAtom& atom) const
{
    if (!IsNecessary(path)) {
        return eTqovixVisitSkip;
    }
    if (path.empty() && m_bEmptyPathIsError) {
        return eTqovixErrorInternal;
    }
    if (atom.GetType() == kHdlr) {
        return AnswerHandler(atom);
    }
    const uint64_t size = atom.GetDataSize();
    const uint8_t* payload = size == 0 ? nullptr : atom.GetData();
    if (!m_bTrack || payload == nullptr) {
        return eTqovixVisitSkip;
    }
    const eTqovixErrorCode result = ReadTable(atom.GetType(), payload, size);
    if (result != eTqovixSuccess) {
        return result;
    }
    if (++m_analyzedTableCount < 3) {
        return eTqovixVisitSkip;
    }
    m_analyzedTableCount = 0;
    return eTqovixSuccess;
}

eTqovixErrorCode CTqovixSampleTableVisitor::ReadTable(eTqovixAtomType type, const uint8_t* payload, uint64_t size) const
{
    // Entries follow from the payload size; the count field is not trusted.
    const uint64_t entriesBytes = size >= 8 ? size - 8 : 0;
    if (type == kCo64 || type == kStco) {
        const uint64_t width = type == kCo64 ? 8 : 4;
        const uint64_t entries = entriesBytes / width;
        if (entries > kMaxTableEntries) {
            return eTqovixErrorInvalidMovie;
        }
        Reserve(m_chunkTable, entries);
        for (uint64_t j = 0; j < entries; ++j) {
            const uint8_t* entry = payload + 8 + width * j;
            m_chunkTable[j].offset = width == 8 ? TqovixReadBE64(entry) : TqovixReadBE32(entry);
        }
        m_recordCount = entries;
    } else if (type == kStsc) {
        const uint64_t entries = entriesBytes / 12;
        if (entries > kMaxTableEntries) {
            return eTqovixErrorInvalidMovie;
        }
        Reserve(m_sampleToChunkTable, entries);
        for (uint64_t j = 0; j < entries; ++j) {
            const uint8_t* entry = payload + 8 + 12 * j;
            m_sampleToChunkTable[j] = {TqovixReadBE32(entry), TqovixReadBE32(entry + 4)};
        }
        m_runEntries = entries;
    } else if (type == kStsz) {
        if (size < 8) {
            return eTqovixErrorInvalidMovie;
        }
        const uint32_t commonSize = TqovixReadBE32(payload + 4);
        if (commonSize != 0) {
            m_constantSampleSize = commonSize;
            return eTqovixSuccess;
        }
        const uint64_t entries = size >= 12 ? (size - 12) / 4 : 0;
        if (entries > kMaxTableEntries) {
            return eTqovixErrorInvalidMovie;
        }
        Reserve(m_sampleSizeTable, entries);
        for (uint64_t j = 0; j < entries; ++j) {
            m_sampleSizeTable[j] = TqovixReadBE32(payload + 12 + 4 * j);
        }
        m_sizeEntries = entries;
    } else {
        return eTqovixErrorInternal;
    }
    return eTqovixSuccess;
}

eTqovixErrorCode CTqovixSampleTableVisitor::BuildChunkList(std::vector<TqovixChunkInformation>& out,
                                                          uint32_t bytesPerSample) const
{
    const uint64_t chunkCount = m_recordCount;
    uint64_t position = 0;
    uint64_t sample = 0;
    bool consistent = chunkCount > 0 && m_runEntries > 0;
    for (uint64_t r = 0; consistent && r < m_runEntries; ++r) {
        const uint64_t first = m_sampleToChunkTable[r].firstChunk;
        const uint64_t next = r + 1 < m_runEntries ? m_sampleToChunkTable[r + 1].firstChunk : chunkCount + 1;
        const uint32_t samplesPerChunk = m_sampleToChunkTable[r].samplesPerChunk;
        // Runs start at chunk 1, rise strictly and name only chunks the offset table has.
        if (first != position + 1 || next <= first || next > chunkCount + 1) {
            consistent = false;
            break;
        }
        for (uint64_t k = first; k < next; ++k, ++position) {
            TqovixChunkInformation& record = m_chunkTable[position];
            uint64_t bytes = 0;
            if (m_constantSampleSize == 0) {
                if (samplesPerChunk > m_sizeEntries - sample) {
                    consistent = false;  // the size table runs out
                    break;
                }
                const auto begin = m_sampleSizeTable.begin() + static_cast<std::ptrdiff_t>(sample);
                record.sampleSizes.assign(begin, begin + samplesPerChunk);
                for (uint32_t size : record.sampleSizes) {
                    bytes += size;
                }
                sample += samplesPerChunk;
            } else {
                // Two steps, each product of 32-bit factors, so nothing wraps in 64 bits.
                bytes = uint64_t{samplesPerChunk} * bytesPerSample;
                if (bytes <= UINT32_MAX) {
                    bytes *= m_constantSampleSize;
                }
            }
            if (bytes > UINT32_MAX) {
                consistent = false;
                break;
            }
            record.size = static_cast<uint32_t>(bytes);
            record.chunkNumber = static_cast<uint32_t>(k);
            record.sampleCount = samplesPerChunk;
        }
    }
    // Every chunk belongs to a run, and a size table holds no sample nobody uses.
    if (position != chunkCount || (m_constantSampleSize == 0 && sample != m_sizeEntries)) {
        consistent = false;
    }
    out.assign(m_chunkTable.begin(), m_chunkTable.begin() + static_cast<std::ptrdiff_t>(chunkCount));
    return consistent ? eTqovixSuccess : eTqovixErrorInvalidMovie;
}

void CTqovixSampleTableVisitor::LoadRecords(const std::vector<TqovixChunkInformation>& chunks, bool withSizes)
{
    if (chunks.empty()) {
        return;
    }
    m_chunkTable.resize(chunks.size());
    for (size_t j = 0; j < chunks.size(); ++j) {
        m_chunkTable[j].offset = chunks[j].offset;
        if (withSizes) {
            m_chunkTable[j].size = chunks[j].size;
            if (m_constantSampleSize == 0) {
                m_chunkTable[j].sampleSizes = chunks[j].sampleSizes;
            }
        }
    }
    m_recordCount = chunks.size();
}

eTqovixErrorCode CTqovixSampleTableVisitor::BeginUpdate(const TqovixAtomPath& path, CTqovixLeafAtom& atom,
                                                       std::vector<uint8_t>& payload) const
{
    if (!IsNecessary(path)) {
        return eTqovixVisitSkip;
    }
    if (path.empty() && m_bEmptyPathIsError) {
        return eTqovixErrorInternal;
    }
    if (atom.GetType() == kHdlr) {
        return AnswerHandler(atom);
    }
    if (!m_bTrack) {
        return eTqovixVisitSkip;
    }
    const uint8_t* data = atom.GetDataSize() == 0 ? nullptr : atom.GetData();
    if (data == nullptr) {
        return eTqovixErrorOutOfMemory;
    }
    payload.assign(data, data + atom.GetDataSize());
    return eTqovixSuccess;
}

eTqovixErrorCode CTqovixSampleTableVisitor::RewriteOffsets(std::vector<uint8_t>& payload, eTqovixAtomType type,
                                                          bool exactCount) const
{
    const bool wide = type == kCo64;
    const uint64_t width = wide ? 8 : 4;
    const uint64_t entries = payload.size() >= 8 ? (payload.size() - 8) / width : 0;
    if (entries > m_recordCount || (exactCount && entries != m_recordCount)) {
        return eTqovixErrorInternal;
    }
    for (uint64_t j = 0; j < entries; ++j) {
        const uint64_t offset = m_chunkTable[j].offset;
        if (wide) {
            TqovixWriteBE64(payload.data() + 8 + 8 * j, offset);
        } else if (offset > UINT32_MAX) {
            return eTqovixErrorInternal;  // only a "co64" table can say where this chunk lies
        } else {
            TqovixWriteBE32(payload.data() + 8 + 4 * j, static_cast<uint32_t>(offset));
        }
    }
    return eTqovixSuccess;
}

eTqovixErrorCode CTqovixSampleTableVisitor::FinishUpdate(CTqovixLeafAtom& atom, const std::vector<uint8_t>& payload,
                                                        uint32_t tablesPerTrack, eTqovixErrorCode unfinished) const
{
    atom.SetData(payload.data(), payload.size());
    if (++m_analyzedTableCount < tablesPerTrack) {
        return unfinished;
    }
    m_analyzedTableCount = 0;
    return eTqovixSuccess;
}

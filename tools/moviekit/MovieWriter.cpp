#include "MovieWriter.h"

#include "MediaSource.h"
#include "MoovBuilder.h"
#include "MoviePlan.h"

#include <cerrno>
#include <cstring>
#include <algorithm>

namespace moviekit {

namespace {

enum class Part { Ftyp, Free, Wide, Mdat, Moov };

struct TopLevel {
    Part part;
    uint32_t mdat = 0;
};

std::vector<TopLevel> TopLevelOrder(const MovieRecipe& recipe, size_t mdatCount)
{
    std::vector<TopLevel> order;
    if (!recipe.ftypAfterMoov) {
        order.push_back({Part::Ftyp});
    }
    if (recipe.freeSize != 0) {
        order.push_back({Part::Free});
    }
    auto moov = [&] {
        order.push_back({Part::Moov});
        if (recipe.ftypAfterMoov) {
            order.push_back({Part::Ftyp});
        }
    };
    if (recipe.moovBeforeMdat) {
        moov();
    }
    if (recipe.wide) {
        order.push_back({Part::Wide});
    }
    for (uint32_t g = 0; g < mdatCount; ++g) {
        order.push_back({Part::Mdat, g});
    }
    if (!recipe.moovBeforeMdat) {
        moov();
    }
    return order;
}

Bytes MdatHeader(uint64_t payloadSize, bool large)
{
    Bytes header;
    if (large) {
        PutU32(header, 1);
        PutType(header, "mdat");
        PutU64(header, payloadSize + 16);
    } else {
        PutU32(header, static_cast<uint32_t>(payloadSize + 8));
        PutType(header, "mdat");
    }
    return header;
}

class MovieWriter {
public:
    MovieWriter(const MovieRecipe& recipe, Sink& sink) : m_recipe(recipe), m_sink(sink) {}

    bool Write(MovieLayout* layout, std::string* error);

private:
    bool Lay(bool co64);
    bool WriteFree();

    const MovieRecipe& m_recipe;
    Sink& m_sink;
    MoviePlan m_plan;
    std::vector<uint64_t> m_payloadSizes;
    std::vector<bool> m_largeHeaders;
    std::vector<TopLevel> m_order;
    std::vector<uint64_t> m_offsets;  // of each entry of m_order
    Bytes m_ftyp;
    Bytes m_moov;
    uint64_t m_fileSize = 0;
};

// Places every atom for the given offset table kind; false when some chunk lies beyond
// what "stco" can address.
bool MovieWriter::Lay(bool co64)
{
    m_moov = BuildMoov(m_recipe, m_plan, co64);
    std::vector<uint64_t> payloadOffsets(m_payloadSizes.size());
    m_offsets.clear();
    uint64_t position = 0;
    for (const TopLevel& item : m_order) {
        m_offsets.push_back(position);
        switch (item.part) {
        case Part::Ftyp: position += m_ftyp.size(); break;
        case Part::Free: position += 8 + uint64_t{m_recipe.freeSize}; break;
        case Part::Wide: position += 8; break;
        case Part::Moov: position += m_moov.size(); break;
        case Part::Mdat: {
            const uint64_t header = m_largeHeaders[item.mdat] ? 16 : 8;
            payloadOffsets[item.mdat] = position + header;
            position += header + m_payloadSizes[item.mdat];
            break;
        }
        }
    }
    m_fileSize = position + m_recipe.trailingBytes.size();
    AssignOffsets(m_plan, payloadOffsets);
    for (const auto* chunks : {&m_plan.soundChunks, &m_plan.videoChunks}) {
        for (const ChunkLayout& chunk : *chunks) {
            if (!co64 && chunk.offset > UINT32_MAX) {
                return false;
            }
        }
    }
    // The moov holds offsets; its size does not depend on them, so one rebuild settles it.
    m_moov = BuildMoov(m_recipe, m_plan, co64);
    return true;
}

bool MovieWriter::WriteFree()
{
    Bytes piece;
    PutU32(piece, m_recipe.freeSize + 8);
    PutType(piece, "free");
    bool written = m_sink.Write(piece);
    piece.assign(1 << 16, 0);
    for (uint64_t left = m_recipe.freeSize; left > 0 && written; left -= piece.size()) {
        piece.resize(std::min<uint64_t>(left, piece.size()));
        written = m_sink.Write(piece);
    }
    return written;
}

bool MovieWriter::Write(MovieLayout* layout, std::string* error)
{
    auto fail = [error](const std::string& reason) { return PlanFail(error, reason); };
    if (m_recipe.movieTimeScale == 0) {
        return fail("movie time scale 0");
    }
    if (m_recipe.freeSize > UINT32_MAX - 8) {
        return fail("free atom too large");
    }
    if (!PlanMovie(m_recipe, &m_plan, error)) {
        return false;
    }
    m_payloadSizes = MdatPayloadSizes(m_plan);
    for (uint64_t size : m_payloadSizes) {
        m_largeHeaders.push_back(m_recipe.largeMdatHeader || size > UINT32_MAX - 8);
    }
    Bytes ftyp;
    PutType(ftyp, m_recipe.majorBrand);
    PutU32(ftyp, m_recipe.minorVersion);
    for (const std::string& brand : m_recipe.compatibleBrands) {
        PutType(ftyp, brand);
    }
    m_ftyp = Atom("ftyp", ftyp);
    m_order = TopLevelOrder(m_recipe, m_plan.mdats.size());
    bool co64 = m_recipe.co64;
    if (!Lay(co64)) {
        co64 = true;
        Lay(co64);
    }

    MovieLayout local;
    MovieLayout& out = layout != nullptr ? *layout : local;
    out = MovieLayout{};
    for (size_t i = 0; i < m_order.size(); ++i) {
        const TopLevel& item = m_order[i];
        bool written = true;
        switch (item.part) {
        case Part::Ftyp: written = m_sink.Write(m_ftyp); break;
        case Part::Free: written = WriteFree(); break;
        case Part::Wide: written = m_sink.Write(Atom("wide", {})); break;
        case Part::Moov:
            out.moovOffset = m_offsets[i];
            out.moovSize = m_moov.size();
            written = m_sink.Write(m_moov);
            break;
        case Part::Mdat: {
            const bool large = m_largeHeaders[item.mdat];
            out.mdatOffsets.push_back(m_offsets[i]);
            out.mdatPayloadOffsets.push_back(m_offsets[i] + (large ? 16 : 8));
            out.mdatPayloadSizes.push_back(m_payloadSizes[item.mdat]);
            written = m_sink.Write(MdatHeader(m_payloadSizes[item.mdat], large));
            MediaSource source(m_recipe, m_plan);
            Bytes* soundBytes = m_recipe.keepSoundBytes ? &out.soundBytes : nullptr;
            for (const ChunkSlot& slot : m_plan.mdats[item.mdat]) {
                written = written && source.WriteChunk(slot, m_sink, soundBytes);
            }
            break;
        }
        }
        if (!written) {
            return fail(std::string("cannot write the movie: ") + std::strerror(errno));
        }
    }
    if (!m_sink.Write(m_recipe.trailingBytes)) {
        return fail(std::string("cannot write the movie: ") + std::strerror(errno));
    }
    if (m_sink.Written() != m_fileSize) {
        return fail("internal error: the movie came out " + std::to_string(m_sink.Written()) + " bytes instead of " +
                    std::to_string(m_fileSize));
    }
    out.soundChunks = m_plan.soundChunks;
    out.videoChunks = m_plan.videoChunks;
    out.fileSize = m_fileSize;
    out.co64 = co64;
    out.soundSampleCount = m_plan.soundSamples;
    out.videoFrameSize = m_plan.videoFrameSize;
    return true;
}

}  // namespace

bool WriteMovieTo(Sink& sink, const MovieRecipe& recipe, MovieLayout* layout, std::string* error)
{
    MovieWriter writer(recipe, sink);
    return writer.Write(layout, error);
}

}  // namespace moviekit

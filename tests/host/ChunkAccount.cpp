#include "host/ChunkAccount.h"

#include <algorithm>
#include <fstream>
#include <iterator>
#include <optional>

namespace jobtest {

namespace {

using Bytes = std::vector<uint8_t>;

struct Box {
    std::string type;
    uint64_t begin = 0;  // payload
    uint64_t end = 0;
};

uint64_t Be(const Bytes& b, uint64_t at, int width)
{
    uint64_t v = 0;
    for (int i = 0; i < width; ++i) {
        v = v << 8 | b.at(at + i);
    }
    return v;
}

std::vector<Box> Children(const Bytes& b, uint64_t begin, uint64_t end)
{
    std::vector<Box> boxes;
    while (begin + 8 <= end) {
        uint64_t size = Be(b, begin, 4);
        uint64_t header = 8;
        if (size == 1) {
            size = Be(b, begin + 8, 8);
            header = 16;
        } else if (size == 0) {
            size = end - begin;
        }
        if (size < header || size > end - begin) {
            break;
        }
        boxes.push_back({std::string(b.begin() + static_cast<long>(begin + 4), b.begin() + static_cast<long>(begin + 8)),
                         begin + header, begin + size});
        begin += size;
    }
    return boxes;
}

// A copy: the lists boxes are found in are often temporaries.
std::optional<Box> Find(const std::vector<Box>& boxes, const std::string& type)
{
    for (const Box& box : boxes) {
        if (box.type == type) {
            return box;
        }
    }
    return std::nullopt;
}

bool Fail(std::string* reason, const std::string& text)
{
    if (reason != nullptr) {
        *reason = text;
    }
    return false;
}

bool ReadTrack(const Bytes& b, const Box& trak, TrackChunks& track, bool& inFile, std::string* reason)
{
    const std::optional<Box> mdia = Find(Children(b, trak.begin, trak.end), "mdia");
    if (!mdia) {
        return Fail(reason, "trak without mdia");
    }
    const std::vector<Box> media = Children(b, mdia->begin, mdia->end);
    const std::optional<Box> hdlr = Find(media, "hdlr");
    const std::optional<Box> minf = Find(media, "minf");
    if (!hdlr || !minf) {
        return Fail(reason, "trak without hdlr or minf");
    }
    track.handler = std::string(b.begin() + static_cast<long>(hdlr->begin + 8), b.begin() + static_cast<long>(hdlr->begin + 12));
    const std::vector<Box> info = Children(b, minf->begin, minf->end);
    inFile = true;
    if (const std::optional<Box> dinf = Find(info, "dinf")) {
        if (const std::optional<Box> dref = Find(Children(b, dinf->begin, dinf->end), "dref")) {
            for (const Box& entry : Children(b, dref->begin + 8, dref->end)) {
                inFile = inFile && (Be(b, entry.begin, 4) & 1) != 0;
            }
        }
    }
    const std::optional<Box> stbl = Find(info, "stbl");
    if (!stbl) {
        return Fail(reason, "no stbl");
    }
    const std::vector<Box> tables = Children(b, stbl->begin, stbl->end);
    const std::optional<Box> stsd = Find(tables, "stsd");
    const std::optional<Box> stsc = Find(tables, "stsc");
    const std::optional<Box> stsz = Find(tables, "stsz");
    const std::optional<Box> stco = Find(tables, "stco");
    const std::optional<Box> co64 = Find(tables, "co64");
    if (!stsd || !stsc || !stsz || stco.has_value() == co64.has_value()) {
        return Fail(reason, "missing sample table in " + track.handler);
    }
    const uint64_t entry = stsd->begin + 8;
    track.format = std::string(b.begin() + static_cast<long>(entry + 4), b.begin() + static_cast<long>(entry + 8));
    // Uncompressed sound counts frames: a common size of 1 or of a frame is one frame.
    uint64_t frameBytes = 0;
    if (track.handler == "soun" && track.format != "mp4a") {
        const uint64_t version = Be(b, entry + 16, 2);
        frameBytes = Be(b, entry + 24, 2) * (Be(b, entry + 26, 2) / 8);
        if (version == 1) {
            frameBytes = Be(b, entry + 44, 4);
        } else if (version == 2 && Be(b, entry + 68, 4) == 1) {
            frameBytes = Be(b, entry + 64, 4);  // the bytes of a packet of one frame
        }
    }
    const uint64_t common = Be(b, stsz->begin + 4, 4);
    const uint64_t sampleCount = Be(b, stsz->begin + 8, 4);
    // Exactly one of the two is there (checked above).
    const uint64_t offsetsBegin = stco ? stco->begin : co64.value().begin;
    const int width = stco ? 4 : 8;
    const uint64_t chunkCount = Be(b, offsetsBegin + 4, 4);
    const uint64_t runCount = Be(b, stsc->begin + 4, 4);
    uint64_t sample = 0;
    for (uint64_t run = 0; run < runCount; ++run) {
        const uint64_t first = Be(b, stsc->begin + 8 + 12 * run, 4);
        const uint64_t perChunk = Be(b, stsc->begin + 12 + 12 * run, 4);
        const uint64_t next = run + 1 < runCount ? Be(b, stsc->begin + 8 + 12 * (run + 1), 4) : chunkCount + 1;
        for (uint64_t chunk = first; chunk < next; ++chunk) {
            uint64_t size = 0;
            if (common != 0) {
                size = perChunk * (frameBytes != 0 ? frameBytes : common);
            } else {
                const uint64_t chunkOffset = Be(b, offsetsBegin + 8 + width * (chunk - 1), width);
                for (uint64_t k = 0; k < perChunk; ++k) {
                    const uint64_t sampleSize = Be(b, stsz->begin + 12 + 4 * (sample + k), 4);
                    track.samples.emplace_back(chunkOffset + size, sampleSize);
                    size += sampleSize;
                }
            }
            sample += perChunk;
            track.chunks.emplace_back(Be(b, offsetsBegin + 8 + width * (chunk - 1), width), size);
        }
    }
    if (track.chunks.size() != chunkCount || (common == 0 && sample != sampleCount)) {
        return Fail(reason, track.handler + ": tables disagree");
    }
    return true;
}

}  // namespace

bool ReadTrackChunks(const std::string& path, std::vector<TrackChunks>& tracks, std::string* reason)
{
    std::ifstream in(path, std::ios::binary);
    const Bytes b((std::istreambuf_iterator<char>(in)), std::istreambuf_iterator<char>());
    const std::optional<Box> moov = Find(Children(b, 0, b.size()), "moov");
    if (!moov) {
        return Fail(reason, "no moov");
    }
    for (const Box& trak : Children(b, moov->begin, moov->end)) {
        if (trak.type != "trak") {
            continue;
        }
        TrackChunks track;
        bool inFile = true;
        if (!ReadTrack(b, trak, track, inFile, reason)) {
            return false;
        }
        if (inFile) {
            tracks.push_back(std::move(track));
        }
    }
    return true;
}

std::vector<std::vector<uint8_t>> SoundPackets(const std::string& path)
{
    std::vector<TrackChunks> tracks;
    std::vector<std::vector<uint8_t>> packets;
    if (!ReadTrackChunks(path, tracks, nullptr)) {
        return packets;
    }
    std::ifstream in(path, std::ios::binary);
    const Bytes b((std::istreambuf_iterator<char>(in)), std::istreambuf_iterator<char>());
    for (const TrackChunks& track : tracks) {
        if (track.handler != "soun") {
            continue;
        }
        for (const auto& [offset, size] : track.samples) {
            if (offset > b.size() || size > b.size() - offset) {
                return {};
            }
            packets.emplace_back(b.begin() + static_cast<long>(offset), b.begin() + static_cast<long>(offset + size));
        }
        break;
    }
    return packets;
}

std::string AccountForEveryByte(const std::string& path)
{
    std::vector<TrackChunks> tracks;
    std::string reason;
    if (!ReadTrackChunks(path, tracks, &reason)) {
        return reason;
    }
    std::ifstream in(path, std::ios::binary);
    const Bytes b((std::istreambuf_iterator<char>(in)), std::istreambuf_iterator<char>());
    std::vector<std::pair<uint64_t, uint64_t>> media;  // mdat payloads
    for (const Box& box : Children(b, 0, b.size())) {
        if (box.type == "mdat") {
            media.emplace_back(box.begin, box.end);
        }
    }
    std::vector<std::pair<uint64_t, uint64_t>> chunks;
    for (const TrackChunks& track : tracks) {
        for (const auto& [offset, size] : track.chunks) {
            if (size != 0) {
                chunks.emplace_back(offset, offset + size);
            }
        }
    }
    std::sort(chunks.begin(), chunks.end());
    // Walk the media data and the chunks side by side: they must tile each other exactly.
    size_t next = 0;
    for (const auto& [begin, end] : media) {
        uint64_t at = begin;
        while (next < chunks.size() && chunks[next].first < end) {
            if (chunks[next].first != at) {
                return "bytes " + std::to_string(at) + " to " + std::to_string(chunks[next].first) +
                       (chunks[next].first > at ? " belong to no chunk" : " belong to two chunks");
            }
            at = chunks[next].second;
            ++next;
        }
        if (at != end) {
            return "media data from " + std::to_string(at) + " to " + std::to_string(end) + " belongs to no chunk";
        }
    }
    if (next != chunks.size()) {
        return "a chunk at " + std::to_string(chunks[next].first) + " lies outside the media data";
    }
    return "";
}

}  // namespace jobtest

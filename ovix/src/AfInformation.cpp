#include "AfInformation.h"

#include "ovix/Ovix.h"

#include <algorithm>
#include <cstring>

namespace ovix {
namespace {

constexpr uint64_t kHeaderSize = 8;
constexpr uint64_t kTableOffset = 16;  // within the payload
constexpr uint64_t kEntrySize = 20;
constexpr uint16_t kProcessedFlag = 1;
constexpr uint16_t kStrengthFull = 1000;

uint16_t Be16(const uint8_t* p) { return static_cast<uint16_t>(p[0] << 8 | p[1]); }
uint32_t Be32(const uint8_t* p) { return uint32_t{p[0]} << 24 | uint32_t{p[1]} << 16 | uint32_t{p[2]} << 8 | p[3]; }
uint64_t Be64(const uint8_t* p) { return uint64_t{Be32(p)} << 32 | Be32(p + 4); }

bool IsAfr1(const uint8_t* payload, uint64_t payloadSize)
{
    return payloadSize >= 4 && std::memcmp(payload, "AFR1", 4) == 0;
}

// Frame position in the session: rescaled, shifted, clipped. 128 bits so that any 64-bit
// position times any 64-bit rate neither wraps nor saturates before clipping. A record that
// gives no rate is taken to count in the session's own rate.
uint64_t MapPosition(uint64_t position, uint64_t fromRate, const SessionTimeline& timeline, bool roundUp)
{
    using Wide = __int128;
    Wide scaled = static_cast<Wide>(position);
    if (fromRate != 0 && fromRate != timeline.rateHz) {
        const Wide numerator = scaled * static_cast<Wide>(timeline.rateHz);
        scaled = numerator / fromRate + ((roundUp && numerator % fromRate != 0) ? 1 : 0);
    }
    const Wide shifted = scaled + timeline.startShift;
    return static_cast<uint64_t>(std::clamp<Wide>(shifted, 0, static_cast<Wide>(timeline.frameCount)));
}

}  // namespace

unsigned long JudgeAfBlock(const uint8_t* block, uint64_t size)
{
    if (block == nullptr || size < kHeaderSize || Be32(block) != size || std::memcmp(block + 4, "OP01", 4) != 0) {
        return kVerdictNotAfBlock;
    }
    const uint8_t* payload = block + kHeaderSize;
    const uint64_t payloadSize = size - kHeaderSize;
    if (payloadSize < 4) {
        return kVerdictNoAfInformation;
    }
    if (!IsAfr1(payload, payloadSize)) {
        return kSuccess;
    }
    if (payloadSize < kTableOffset || Be16(payload + 4) != 1) {
        return kVerdictMalformed;
    }
    const uint64_t count = Be32(payload + 12);
    if (count > (payloadSize - kTableOffset) / kEntrySize) {
        return kVerdictMalformed;
    }
    uint64_t previousEnd = 0;
    for (uint64_t i = 0; i < count; ++i) {
        const uint8_t* entry = payload + kTableOffset + i * kEntrySize;
        const uint64_t start = Be64(entry);
        const uint64_t end = Be64(entry + 8);
        if (end < start || start < previousEnd) {
            return kVerdictMalformed;
        }
        previousEnd = end;
    }
    if ((Be16(payload + 6) & kProcessedFlag) != 0) {
        return kVerdictAlreadyProcessed;
    }
    return kSuccess;
}

AfInformation::AfInformation(std::vector<uint8_t> block)
    : m_block(std::move(block)),
      m_recognised(m_block.size() >= kHeaderSize && IsAfr1(m_block.data() + kHeaderSize, m_block.size() - kHeaderSize))
{
}

std::vector<uint8_t> AfInformation::ProcessedBlock() const
{
    std::vector<uint8_t> processed = m_block;
    if (m_recognised) {
        processed[kHeaderSize + 7] |= kProcessedFlag;
    }
    return processed;
}

std::vector<DriveSpan> AfInformation::Spans(const SessionTimeline& timeline) const
{
    std::vector<DriveSpan> spans;
    if (!m_recognised) {
        return spans;
    }
    const uint8_t* payload = m_block.data() + kHeaderSize;
    const uint64_t recordRate = Be32(payload + 8);
    const uint64_t count = Be32(payload + 12);
    spans.reserve(count);
    for (uint64_t i = 0; i < count; ++i) {
        const uint8_t* entry = payload + kTableOffset + i * kEntrySize;
        const uint16_t strength = std::min(Be16(entry + 16), kStrengthFull);
        const uint64_t start = MapPosition(Be64(entry), recordRate, timeline, false);
        const uint64_t end = MapPosition(Be64(entry + 8), recordRate, timeline, true);
        // A drive of strength 0 is left as it came, but it is still the lens's: it tells how the
        // motor sounds, and its sound is no wanted sound's surroundings.
        if (start < end) {
            spans.push_back({start, end, static_cast<float>(strength) / kStrengthFull});
        }
    }
    return spans;
}

}  // namespace ovix

// The AF information block ("OP01" atom with an "AFR1" payload, or a foreign camera payload):
// verdict, the AF drive intervals mapped onto a session's frames, and the processed copy.
#pragma once

#include <ovix/Ovix.h>

#include <cstdint>
#include <vector>

namespace ovix {

// Larger blocks are refused before anything is allocated for them.
inline constexpr uint64_t kMaxBlockSize = kOvixMaxBlockSize;

// A stretch of a session's frames where the lens motor ran; strength 0..1.
struct DriveSpan {
    uint64_t start = 0;
    uint64_t end = 0;  // exclusive
    float strength = 0.0f;
};

// Where the AF positions land in the session's audio.
struct SessionTimeline {
    uint64_t rateHz = 0;
    int64_t startShift = 0;  // added to every mapped position
    uint64_t frameCount = 0;  // positions are clipped to [0, frameCount)
};

// 0 to accept, otherwise the verdict 7, 8, 9 or 20; never reads past `size`.
unsigned long JudgeAfBlock(const uint8_t* block, uint64_t size);

class AfInformation {
public:
    // Takes a block that JudgeAfBlock accepted.
    explicit AfInformation(std::vector<uint8_t> block);

    bool IsForeign() const { return !m_recognised; }
    // The block as written back: the processed flag set, foreign payloads unchanged.
    std::vector<uint8_t> ProcessedBlock() const;
    // Sorted spans, empty ones dropped; neighbours may touch after rounding.
    std::vector<DriveSpan> Spans(const SessionTimeline& timeline) const;

private:
    std::vector<uint8_t> m_block;
    bool m_recognised = false;
};

}  // namespace ovix

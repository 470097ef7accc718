#include "visitor/CTqovixTrimInformationVisitor.h"

#include <vector>

#include "atom/CTqovixLeafAtom.h"
#include "atom/CTqovixTCTGAtom.h"

namespace {

constexpr uint16_t kTagRemovedFrameForward = 20;
constexpr uint16_t kTagRemovedFrameBackward = 21;
constexpr uint16_t kTagFrameRate = 22;
constexpr uint16_t kTypeLong = 4;
constexpr uint16_t kTypeRational = 5;

}  // namespace

CTqovixTrimInformationVisitor::CTqovixTrimInformationVisitor()
    : CTqovixPathTargetVisitor({TqovixAtom::kMoov, TqovixAtom::kUdta, TqovixAtom::kTCDT, TqovixAtom::kTCTG})
{
}

eTqovixErrorCode CTqovixTrimInformationVisitor::Update(const TqovixAtomPath&, CTqovixContainerAtom&) const
{
    return eTqovixErrorInternal;
}

eTqovixErrorCode CTqovixTrimInformationVisitor::Update(const TqovixAtomPath&, CTqovixLeafAtom&) const
{
    return eTqovixErrorInternal;
}

eTqovixErrorCode CTqovixTrimInformationVisitor::Analyze(const TqovixAtomPath& path, const CTqovixLeafAtom& atom) const
{
    if (!IsTarget(path) || atom.GetDataSize() == 0) {
        return eTqovixVisitSkip;
    }
    CTqovixTCTGAtom tags(atom.GetData(), atom.GetDataSize());
    if (!tags.FindNextTag()) {
        return eTqovixVisitSkip;
    }
    // Counts acceptances, not distinct numbers: a repeated tag counts again.
    int found = 0;
    std::vector<uint32_t> longs;
    std::vector<TCTG::TqovixURational> rationals;
    do {
        if (tags.GetTagGroup() != 0) {
            continue;
        }
        switch (tags.GetTagNumber()) {
        case kTagRemovedFrameForward:
        case kTagRemovedFrameBackward:
            tags.GetTagData(longs);
            if (tags.GetTagType() == kTypeLong && longs.size() == 2) {
                (tags.GetTagNumber() == kTagRemovedFrameForward ? m_removedFrameForward : m_removedFrameBackward) =
                    longs[0];
                ++found;
            }
            break;
        case kTagFrameRate:
            tags.GetTagData(rationals);
            if (tags.GetTagType() == kTypeRational && rationals.size() == 1) {
                m_frameRateNumerator = rationals[0].numerator;
                m_frameRateDenominator = rationals[0].denominator;
                ++found;
            }
            break;
        default:
            break;
        }
        if (found == 3) {
            return eTqovixSuccess;
        }
    } while (tags.FindNextTag());
    return eTqovixVisitSkip;
}

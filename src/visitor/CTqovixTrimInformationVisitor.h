// Reads the trim information (frames removed forward and backward, frame
// rate) from tags 20, 21 and 22 of the camera's tag atom.
#pragma once

#include <cstdint>

#include "atom/CTqovixAtomVisitor.h"

class CTqovixTrimInformationVisitor : public CTqovixPathTargetVisitor {
public:
    CTqovixTrimInformationVisitor();

    using CTqovixPathTargetVisitor::Analyze;
    // Reads only: every update answers 36864.
    eTqovixErrorCode Update(const TqovixAtomPath& path, CTqovixContainerAtom& atom) const override;
    eTqovixErrorCode Analyze(const TqovixAtomPath& path, const CTqovixLeafAtom& atom) const override;
    eTqovixErrorCode Update(const TqovixAtomPath& path, CTqovixLeafAtom& atom) const override;
    uint32_t GetRemovedFrameForward() const { return m_removedFrameForward; }
    uint32_t GetRemovedFrameBackward() const { return m_removedFrameBackward; }
    uint32_t GetFrameRateNumerator() const { return m_frameRateNumerator; }
    uint32_t GetFrameRateDenominator() const { return m_frameRateDenominator; }

private:
    mutable uint32_t m_removedFrameForward = 0;
    mutable uint32_t m_removedFrameBackward = 0;
    mutable uint32_t m_frameRateNumerator = 0;
    mutable uint32_t m_frameRateDenominator = 0;
};

// Rewrites the camera's tag atom so that it names this system as the software
// that wrote the movie, keeping every other tag as it was.
#pragma once

#include "atom/CTqovixAtomVisitor.h"

class CTqovixTCTGAtomVisitor : public CTqovixPathTargetVisitor {
public:
    CTqovixTCTGAtomVisitor();

    using CTqovixPathTargetVisitor::Update;
    // Updates only: every analysis answers 36864.
    eTqovixErrorCode Analyze(const TqovixAtomPath& path, const CTqovixContainerAtom& atom) const override;
    eTqovixErrorCode Analyze(const TqovixAtomPath& path, const CTqovixLeafAtom& atom) const override;
    eTqovixErrorCode Update(const TqovixAtomPath& path, CTqovixLeafAtom& atom) const override;
};

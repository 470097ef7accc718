// Rewrites the camera's tag atom so that it names this system as the software
// that wrote the movie, keeping every other tag as it was.
#pragma once

#include "atom/CTqovixAtomVisitor.h"

class CTqovixTCTGAtomVisitor : public CTqovixAtomVisitor {
public:
    CTqovixTCTGAtomVisitor();

    eTqovixErrorCode Analyze(const TqovixAtomPath& path, const CTqovixContainerAtom& atom) const override;
    eTqovixErrorCode Update(const TqovixAtomPath& path, CTqovixContainerAtom& atom) const override;
    eTqovixErrorCode Analyze(const TqovixAtomPath& path, const CTqovixLeafAtom& atom) const override;
    eTqovixErrorCode Update(const TqovixAtomPath& path, CTqovixLeafAtom& atom) const override;
    void SetNeedAnalyzeMediaTime(bool) const override {}

    bool IsNecessary(const TqovixAtomPath& path, bool isLeaf) const { return m_target.IsNecessary(path, isLeaf); }

private:
    CTqovixPathTarget m_target;
};

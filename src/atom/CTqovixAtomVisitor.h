// What a walk over the atom tree tells a visitor, and the codes it answers with:
// 155 go into this container (or go on), 156 pass over it, anything else stops
// the walk (0 = found what it wanted, 4096 and above = error).
#pragma once

#include <utility>

#include "atom/TqovixAtomType.h"
#include "bridge/TqovixErrorCode.h"

class CTqovixContainerAtom;
class CTqovixLeafAtom;

class CTqovixAtomVisitor {
public:
    virtual eTqovixErrorCode Analyze(const TqovixAtomPath& path, const CTqovixContainerAtom& atom) const = 0;
    virtual eTqovixErrorCode Update(const TqovixAtomPath& path, CTqovixContainerAtom& atom) const = 0;
    virtual eTqovixErrorCode Analyze(const TqovixAtomPath& path, const CTqovixLeafAtom& atom) const = 0;
    virtual eTqovixErrorCode Update(const TqovixAtomPath& path, CTqovixLeafAtom& atom) const = 0;
    // Told on entering a "trak" whether it has an edit list, before any child is visited.
    virtual void SetNeedAnalyzeMediaTime(bool needAnalyzeMediaTime) const = 0;
    // Told when every child of a container it went into has been visited, in both walks,
    // so that a visitor can decide per track. 0 ends the walk; 155 or 156 goes on.
    virtual eTqovixErrorCode Leave(const TqovixAtomPath&, const CTqovixContainerAtom&) const
    {
        return eTqovixVisitSkip;
    }

protected:
    // Visitors live on the stack for one walk and are never deleted through this base.
    ~CTqovixAtomVisitor() = default;
};

// The rule shared by visitors that look for one atom at a fixed path: containers
// on the way lead in, leaves other than the target are passed over.
class CTqovixPathTarget {
public:
    explicit CTqovixPathTarget(TqovixAtomPath target) : m_target(std::move(target)) {}

    bool IsNecessary(const TqovixAtomPath& path, bool isLeaf) const;
    // 155 for a container on the way to the target, 156 otherwise.
    eTqovixErrorCode ContainerAnswer(const TqovixAtomPath& path) const;
    const TqovixAtomPath& GetTarget() const { return m_target; }

private:
    TqovixAtomPath m_target;
};

// Base of the visitors that look for one atom at a fixed path: containers on
// the way lead in (in both walks), nothing is told about media time.
class CTqovixPathTargetVisitor : public CTqovixAtomVisitor {
public:
    eTqovixErrorCode Analyze(const TqovixAtomPath& path, const CTqovixContainerAtom&) const override
    {
        return m_target.ContainerAnswer(path);
    }
    eTqovixErrorCode Update(const TqovixAtomPath& path, CTqovixContainerAtom&) const override
    {
        return m_target.ContainerAnswer(path);
    }
    using CTqovixAtomVisitor::Analyze;
    using CTqovixAtomVisitor::Update;
    void SetNeedAnalyzeMediaTime(bool) const override {}

    bool IsNecessary(const TqovixAtomPath& path, bool isLeaf) const { return m_target.IsNecessary(path, isLeaf); }

protected:
    explicit CTqovixPathTargetVisitor(TqovixAtomPath target) : m_target(std::move(target)) {}
    ~CTqovixPathTargetVisitor() = default;

    bool IsTarget(const TqovixAtomPath& path) const { return m_target.IsNecessary(path, true); }

private:
    CTqovixPathTarget m_target;
};

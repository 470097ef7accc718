// Parses a source movie into an atom tree (headers only; payloads stay on disk)
// and carries visitors over it.
#pragma once

#include "atom/CTqovixAtom.h"

class CTqovixFile;

class CTqovixAtomControl {
public:
    // Bounds on what a hostile file can make the parser build.
    static constexpr int kMaxDepth = 32;
    static constexpr size_t kMaxAtoms = 100000;

    // Accepts only movies whose major brand is "mp42" or "qt  " and whose
    // top-level atoms account for every byte of the file; otherwise 4359.
    eTqovixErrorCode Initialize(CTqovixFile& file);
    eTqovixErrorCode Analyze(CTqovixAtomVisitor& visitor) const;
    eTqovixErrorCode Update(const CTqovixAtomVisitor& visitor) const;
    eTqovixErrorCode GetAtoms(TqovixAtomList& atoms) const;
    void Close() { m_atoms.clear(); }
    bool IsInitialized() const { return !m_atoms.empty(); }

private:
    TqovixAtomList m_atoms;
};

// An atom whose payload is a sequence of atoms ("moov", "trak", "udta", ...).
#pragma once

#include "atom/CTqovixAtom.h"

class CTqovixContainerAtom : public CTqovixAtom {
public:
    CTqovixContainerAtom(eTqovixAtomType type, TqovixAtomList children, bool largeHeader = false);

    eTqovixErrorCode Analyze(CTqovixAtomVisitor& visitor, const TqovixAtomPath& path) const override;
    const uint8_t* GetData() const override { return nullptr; }
    uint64_t GetDataSize() const override { return 0; }
    uint64_t GetSize() const override;
    eTqovixAtomType GetType() const override { return m_type; }
    eTqovixErrorCode Update(const CTqovixAtomVisitor& visitor, const TqovixAtomPath& path) override;
    eTqovixErrorCode Write(CTqovixFile& file) const override;

    const TqovixAtomList& GetChildren() const { return m_children; }

private:
    eTqovixAtomType m_type;
    TqovixAtomList m_children;
    bool m_bLargeHeader;
};

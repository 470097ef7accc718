// One atom of a movie's atom tree, held through shared pointers: a container
// of other atoms or a leaf whose payload is read from the source only on demand.
#pragma once

#include <cstdint>
#include <memory>
#include <vector>

#include "atom/TqovixAtomType.h"
#include "bridge/TqovixErrorCode.h"

class CTqovixAtomVisitor;
class CTqovixFile;
class CTqovixAtom;

using TqovixAtomList = std::vector<std::shared_ptr<CTqovixAtom>>;

class CTqovixAtom {
public:
    // The largest atom whose size still fits the 32-bit size field.
    static constexpr uint64_t kMaxCompactAtomSize = 4294967295ULL;

    virtual ~CTqovixAtom() = default;
    virtual eTqovixErrorCode Analyze(CTqovixAtomVisitor& visitor, const TqovixAtomPath& path) const = 0;
    virtual const uint8_t* GetData() const = 0;
    virtual uint64_t GetDataSize() const = 0;
    virtual uint64_t GetSize() const = 0;
    virtual eTqovixAtomType GetType() const = 0;
    virtual eTqovixErrorCode Update(const CTqovixAtomVisitor& visitor, const TqovixAtomPath& path) = 0;
    virtual eTqovixErrorCode Write(CTqovixFile& file) const = 0;

    bool IsExistAtom(TqovixAtomList atoms, eTqovixAtomType type) const;

protected:
    // Whole-atom size for a payload; a 16-byte header when the source used one
    // (so the atom is written back as it was read) or when 32 bits cannot hold it.
    static uint64_t SizeWithHeader(uint64_t payloadSize, bool largeHeader);
    eTqovixErrorCode WriteHeader(CTqovixFile& file, bool largeHeader) const;
};

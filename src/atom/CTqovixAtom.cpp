#include "atom/CTqovixAtom.h"

#include "atom/TqovixEndian.h"
#include "file/CTqovixFile.h"

bool CTqovixAtom::IsExistAtom(TqovixAtomList atoms, eTqovixAtomType type) const
{
    for (const auto& atom : atoms) {
        if (atom && atom->GetType() == type) {
            return true;
        }
    }
    return false;
}

uint64_t CTqovixAtom::SizeWithHeader(uint64_t payloadSize, bool largeHeader)
{
    if (!largeHeader && payloadSize <= kMaxCompactAtomSize - 8) {
        return payloadSize + 8;
    }
    return payloadSize + 16;
}

eTqovixErrorCode CTqovixAtom::WriteHeader(CTqovixFile& file, bool largeHeader) const
{
    if (!file.IsOpened()) {
        return eTqovixErrorInternal;
    }
    const uint64_t size = GetSize();
    const bool extended = largeHeader || size > kMaxCompactAtomSize;
    uint8_t header[16];
    TqovixWriteBE32(header, extended ? 1U : static_cast<uint32_t>(size));
    const uint32_t type = GetType();
    std::memcpy(header + 4, &type, 4);  // type bytes go out in the order they were read
    if (extended) {
        TqovixWriteBE64(header + 8, size);
    }
    return file.Write(header, extended ? 16U : 8U);
}

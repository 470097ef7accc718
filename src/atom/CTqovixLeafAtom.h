// An atom whose payload is opaque bytes. The payload stays in the source file
// until someone asks for it, so the media data is never loaded by a parse.
#pragma once

#include <vector>

#include "atom/CTqovixAtom.h"

class CTqovixLeafAtom : public CTqovixAtom {
public:
    CTqovixLeafAtom(eTqovixAtomType type, CTqovixFile* file, long long offset, uint64_t size,
                    bool largeHeader = false);

    eTqovixErrorCode Analyze(CTqovixAtomVisitor& visitor, const TqovixAtomPath& path) const override;
    // Reads an on-disk payload first; null when the payload is empty or cannot be read.
    const uint8_t* GetData() const override;
    uint64_t GetDataSize() const override;
    uint64_t GetSize() const override;
    eTqovixAtomType GetType() const override { return m_type; }
    eTqovixErrorCode Update(const CTqovixAtomVisitor& visitor, const TqovixAtomPath& path) override;
    eTqovixErrorCode Write(CTqovixFile& file) const override;

    void SetData(const void* data, uint64_t size);
    // A table that outgrew its form (an "stco" turned "co64").
    void SetType(eTqovixAtomType type) { m_type = type; }

    // GetData with the reason of a failure: the file layer's code, 4352 when the
    // payload cannot be held in memory, 4359 when it lies beyond the file's end.
    eTqovixErrorCode LoadData() const;
    bool IsOnDisk() const { return m_pFile != nullptr; }
    long long GetOffset() const { return m_offset; }

private:
    eTqovixErrorCode CheckPayloadInFile() const;
    // Source to destination without holding more than a piece of the payload.
    eTqovixErrorCode CopyPayload(CTqovixFile& file) const;

    eTqovixAtomType m_type;
    mutable std::vector<uint8_t> m_data;
    mutable CTqovixFile* m_pFile;
    // A payload that could not be read while a visitor looked at it: the walk reports this
    // rather than what the visitor made of the missing bytes.
    mutable eTqovixErrorCode m_loadFailure = eTqovixSuccess;
    long long m_offset;
    uint64_t m_size;
    bool m_bLargeHeader;
};

// Copies one maker data atom out of the tree, header and all, in an Analyze
// walk, and replaces its payload with a block set by the caller in an Update walk.
// The AF information and audio level visitors are this with their own path.
#pragma once

#include <cstdint>
#include <vector>

#include "atom/CTqovixAtomVisitor.h"

class CTqovixMakerBlockVisitor : public CTqovixPathTargetVisitor {
public:
    using CTqovixPathTargetVisitor::Analyze;
    using CTqovixPathTargetVisitor::Update;
    eTqovixErrorCode Analyze(const TqovixAtomPath& path, const CTqovixLeafAtom& atom) const override;
    eTqovixErrorCode Update(const TqovixAtomPath& path, CTqovixLeafAtom& atom) const override;

protected:
    CTqovixMakerBlockVisitor(eTqovixAtomType leafType, eTqovixErrorCode emptyAtomCode);
    ~CTqovixMakerBlockVisitor() = default;

    // Keeps the payload of a block laid out as an atom (8-byte header, or 16
    // when the size field is 0).
    void SetBlock(const void* data, uint64_t size);
    const uint8_t* GetBlock() const { return m_block.empty() ? nullptr : m_block.data(); }
    uint64_t GetBlockSize() const { return m_block.size(); }
    // Hands the block over without a copy; the visitor is empty afterwards.
    std::vector<uint8_t> TakeBlock() { return std::move(m_block); }

private:
    eTqovixErrorCode m_emptyAtomCode;
    mutable std::vector<uint8_t> m_block;
    eTqovixErrorCode m_setFailure = eTqovixSuccess;  // a block that could not be held
};

class CTqovixAFInformationVisitor : public CTqovixMakerBlockVisitor {
public:
    CTqovixAFInformationVisitor();

    void SetAFInformation(const void* data, uint64_t size) { SetBlock(data, size); }
    const uint8_t* GetAFInformation() const { return GetBlock(); }
    uint64_t GetAFInformationSize() const { return GetBlockSize(); }
    std::vector<uint8_t> TakeAFInformation() { return TakeBlock(); }
};

class CTqovixAudioLevelInformationVisitor : public CTqovixMakerBlockVisitor {
public:
    CTqovixAudioLevelInformationVisitor();
    virtual ~CTqovixAudioLevelInformationVisitor() = default;

    void SetAudioLevelInformation(const void* data, uint64_t size) { SetBlock(data, size); }
    const uint8_t* GetAudioLevelInformation() const { return GetBlock(); }
    uint64_t GetAudioLevelInformationSize() const { return GetBlockSize(); }
    std::vector<uint8_t> TakeAudioLevelInformation() { return TakeBlock(); }
};

// Read-only cursor over the camera's tag atom ("TCTG"): TIFF-style tags of
// group, number, field type and count, one after another; plus the writer of one tag.
#pragma once

#include <cstdint>
#include <vector>

namespace TCTG {

inline constexpr const char TCTG_SOFTWARE_NAME[] = "VELDA OVIX Utility";

struct TqovixTCTGTag {
    uint16_t group = 0;
    uint16_t number = 0;
    uint16_t type = 0;
    uint16_t count = 0;
    std::vector<uint8_t> data;  // values exactly as they go into the file (big-endian)
};

struct TqovixURational {
    uint32_t numerator = 0;
    uint32_t denominator = 0;
};

}  // namespace TCTG

class CTqovixTCTGAtom {
public:
    CTqovixTCTGAtom(const uint8_t* data, uint64_t size) : m_pData(data), m_size(data != nullptr ? size : 0) {}

    // Moves to the next tag; false at the end, and for a tag that does not fit
    // in what is left of the payload (the walk ends there).
    bool FindNextTag();
    uint16_t GetTagGroup() const;
    uint16_t GetTagNumber() const;
    uint16_t GetTagType() const;
    uint16_t GetTagCount() const;
    uint32_t GetTagDataSize() const;
    uint32_t GetTagSize() const;
    // The current tag's bytes (header and values); null without a current tag.
    const uint8_t* GetTag() const { return HasTag() ? m_pTag : nullptr; }
    void GetTagData(std::vector<uint32_t>& values) const;
    void GetTagData(std::vector<TCTG::TqovixURational>& values) const;

    static bool AppendTag(std::vector<uint8_t>& out, const TCTG::TqovixTCTGTag& tag);
    static uint32_t ValueSize(uint16_t type);

private:
    bool HasTag() const { return m_pTag != nullptr && m_pTag < m_pData + m_size; }
    uint16_t HeaderField(int index) const;

    const uint8_t* m_pData;
    uint64_t m_size;
    const uint8_t* m_pTag = nullptr;
};

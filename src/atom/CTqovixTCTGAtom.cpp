#include "atom/CTqovixTCTGAtom.h"

#include "atom/TqovixEndian.h"

uint32_t CTqovixTCTGAtom::ValueSize(uint16_t type)
{
    switch (type) {
    case 3:   // SHORT
    case 8:   // SSHORT
        return 2;
    case 4:   // LONG
    case 9:   // SLONG
        return 4;
    case 5:   // RATIONAL
    case 10:  // SRATIONAL
        return 8;
    default:  // BYTE, ASCII, SBYTE, UNDEFINED and unknown types
        return 1;
    }
}

bool CTqovixTCTGAtom::FindNextTag()
{
    if (m_pData == nullptr || m_size == 0) {
        return false;
    }
    const uint8_t* const end = m_pData + m_size;
    if (m_pTag != nullptr && m_pTag >= end) {
        return false;
    }
    const uint64_t start = m_pTag == nullptr ? 0 : static_cast<uint64_t>(m_pTag - m_pData) + GetTagSize();
    const uint64_t left = start < m_size ? m_size - start : 0;
    if (left < 8 || left < 8 + static_cast<uint64_t>(ValueSize(TqovixReadBE16(m_pData + start + 4))) *
                                     TqovixReadBE16(m_pData + start + 6)) {
        m_pTag = end;  // nothing more can be read; later calls stay at the end
        return false;
    }
    m_pTag = m_pData + start;
    return true;
}

uint16_t CTqovixTCTGAtom::HeaderField(int index) const
{
    return HasTag() ? TqovixReadBE16(m_pTag + 2 * index) : 0;
}

uint16_t CTqovixTCTGAtom::GetTagGroup() const { return HeaderField(0); }
uint16_t CTqovixTCTGAtom::GetTagNumber() const { return HeaderField(1); }
uint16_t CTqovixTCTGAtom::GetTagType() const { return HeaderField(2); }
uint16_t CTqovixTCTGAtom::GetTagCount() const { return HeaderField(3); }

uint32_t CTqovixTCTGAtom::GetTagDataSize() const { return ValueSize(GetTagType()); }

uint32_t CTqovixTCTGAtom::GetTagSize() const { return 8 + GetTagDataSize() * GetTagCount(); }

void CTqovixTCTGAtom::GetTagData(std::vector<uint32_t>& values) const
{
    values.clear();
    if (!HasTag() || GetTagDataSize() != 4) {
        return;
    }
    const uint16_t count = GetTagCount();
    values.reserve(count);
    for (uint16_t i = 0; i < count; ++i) {
        values.push_back(TqovixReadBE32(m_pTag + 8 + 4 * i));
    }
}

void CTqovixTCTGAtom::GetTagData(std::vector<TCTG::TqovixURational>& values) const
{
    values.clear();
    if (!HasTag() || GetTagDataSize() != 8) {
        return;
    }
    const uint16_t count = GetTagCount();
    values.reserve(count);
    for (uint16_t i = 0; i < count; ++i) {
        const uint8_t* value = m_pTag + 8 + 8 * i;
        values.push_back({TqovixReadBE32(value), TqovixReadBE32(value + 4)});
    }
}

bool CTqovixTCTGAtom::AppendTag(std::vector<uint8_t>& out, const TCTG::TqovixTCTGTag& tag)
{
    uint8_t header[8];
    TqovixWriteBE16(header, tag.group);
    TqovixWriteBE16(header + 2, tag.number);
    TqovixWriteBE16(header + 4, tag.type);
    TqovixWriteBE16(header + 6, tag.count);
    out.insert(out.end(), header, header + 8);
    out.insert(out.end(), tag.data.begin(), tag.data.end());
    return true;
}

#include "atom/TqovixAtomType.h"

bool IsContainerAtom(eTqovixAtomType type)
{
    using namespace TqovixAtom;
    switch (type) {
    case kMoov:
    case kTrak:
    case kMdia:
    case kMinf:
    case kStbl:
    case kEdts:
    case kUdta:
    case kTCDT:
    case kTCDB:
        return true;
    default:
        return false;
    }
}

std::string TqovixAtomTypeName(eTqovixAtomType type)
{
    std::string name(4, '.');
    for (int i = 0; i < 4; ++i) {
        const auto c = static_cast<unsigned char>((static_cast<uint32_t>(type) >> (8 * i)) & 0xFF);
        if (c >= 0x20 && c < 0x7F) {
            name[i] = static_cast<char>(c);
        }
    }
    return name;
}

TqovixAtomPath TqovixMakeAtomPath(const std::string& types)
{
    TqovixAtomPath path;
    for (size_t i = 0; i + 4 <= types.size(); i += 4) {
        uint32_t value = 0;
        for (size_t j = 0; j < 4; ++j) {
            value |= static_cast<uint32_t>(static_cast<uint8_t>(types[i + j])) << (8 * j);
        }
        path.push_back(static_cast<eTqovixAtomType>(value));
    }
    return path;
}

// Four-character atom types as held in memory: the four type bytes in file
// order read as a little-endian integer, so they are never byte-swapped.
#pragma once

#include <cstdint>
#include <string>
#include <vector>

enum eTqovixAtomType : uint32_t {};

constexpr eTqovixAtomType TqovixMakeAtomType(const char (&text)[5])
{
    return static_cast<eTqovixAtomType>(static_cast<uint32_t>(static_cast<uint8_t>(text[0])) |
                                        static_cast<uint32_t>(static_cast<uint8_t>(text[1])) << 8 |
                                        static_cast<uint32_t>(static_cast<uint8_t>(text[2])) << 16 |
                                        static_cast<uint32_t>(static_cast<uint8_t>(text[3])) << 24);
}

namespace TqovixAtom {
inline constexpr eTqovixAtomType kFtyp = TqovixMakeAtomType("ftyp");
inline constexpr eTqovixAtomType kMdat = TqovixMakeAtomType("mdat");
inline constexpr eTqovixAtomType kMoov = TqovixMakeAtomType("moov");
inline constexpr eTqovixAtomType kTrak = TqovixMakeAtomType("trak");
inline constexpr eTqovixAtomType kMdia = TqovixMakeAtomType("mdia");
inline constexpr eTqovixAtomType kMinf = TqovixMakeAtomType("minf");
inline constexpr eTqovixAtomType kStbl = TqovixMakeAtomType("stbl");
inline constexpr eTqovixAtomType kEdts = TqovixMakeAtomType("edts");
inline constexpr eTqovixAtomType kUdta = TqovixMakeAtomType("udta");
inline constexpr eTqovixAtomType kTCDT = TqovixMakeAtomType("TCDT");
inline constexpr eTqovixAtomType kTCDB = TqovixMakeAtomType("TCDB");
inline constexpr eTqovixAtomType kTCTG = TqovixMakeAtomType("TCTG");
inline constexpr eTqovixAtomType kOP01 = TqovixMakeAtomType("OP01");
inline constexpr eTqovixAtomType kOP02 = TqovixMakeAtomType("OP02");
}  // namespace TqovixAtom

// From the top-level atom down to (and including) the atom being visited.
using TqovixAtomPath = std::vector<eTqovixAtomType>;

bool IsContainerAtom(eTqovixAtomType type);

// The four type bytes as text, unprintable bytes shown as '.'.
std::string TqovixAtomTypeName(eTqovixAtomType type);

// Builds a path from concatenated four-character types such as "moovudtaTCDT".
TqovixAtomPath TqovixMakeAtomPath(const std::string& types);

// What the track visitors share: which paths they want and the handler test
// that tells a sound or video track from the others.
#pragma once

#include <initializer_list>

#include "atom/TqovixAtomType.h"
#include "bridge/TqovixErrorCode.h"

class CTqovixLeafAtom;

namespace TqovixTrackPath {

inline constexpr eTqovixAtomType kHdlr = TqovixMakeAtomType("hdlr");
inline constexpr eTqovixAtomType kStsd = TqovixMakeAtomType("stsd");
inline constexpr eTqovixAtomType kEsds = TqovixMakeAtomType("esds");
inline constexpr eTqovixAtomType kStts = TqovixMakeAtomType("stts");
inline constexpr eTqovixAtomType kElst = TqovixMakeAtomType("elst");
inline constexpr eTqovixAtomType kStsc = TqovixMakeAtomType("stsc");
inline constexpr eTqovixAtomType kStsz = TqovixMakeAtomType("stsz");
inline constexpr eTqovixAtomType kStco = TqovixMakeAtomType("stco");
inline constexpr eTqovixAtomType kCo64 = TqovixMakeAtomType("co64");

// A path is wanted when it is no longer than `wanted` and agrees with it
// element by element, except at the wanted path's last position, where any
// of `lastTypes` is accepted. Shorter paths (the containers on the way) count.
bool IsWanted(const TqovixAtomPath& path, const TqovixAtomPath& wanted,
              std::initializer_list<eTqovixAtomType> lastTypes);

// moov/trak/mdia/minf/stbl with one more element to be filled by IsWanted.
const TqovixAtomPath& SampleTablePath();

// 155 when a handler atom's payload names component type "mhlr" and the
// given subtype ("soun", "vide"), else 156.
eTqovixErrorCode HandlerAnswer(const CTqovixLeafAtom& handler, const char (&subtype)[5]);

}  // namespace TqovixTrackPath

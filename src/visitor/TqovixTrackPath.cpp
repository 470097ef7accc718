#include "visitor/TqovixTrackPath.h"

#include <algorithm>
#include <cstring>

#include "atom/CTqovixLeafAtom.h"
#include "atom/TqovixTrackAtoms.h"

namespace TqovixTrackPath {

bool IsWanted(const TqovixAtomPath& path, const TqovixAtomPath& wanted,
              std::initializer_list<eTqovixAtomType> lastTypes)
{
    if (path.size() > wanted.size()) {
        return false;
    }
    for (size_t i = 0; i < path.size(); ++i) {
        if (i + 1 == wanted.size()) {
            if (std::find(lastTypes.begin(), lastTypes.end(), path[i]) == lastTypes.end()) {
                return false;
            }
        } else if (path[i] != wanted[i]) {
            return false;
        }
    }
    return true;
}

const TqovixAtomPath& SampleTablePath()
{
    static const TqovixAtomPath path = TqovixMakeAtomPath("moovtrakmdiaminfstbl____");
    return path;
}

eTqovixErrorCode HandlerAnswer(const CTqovixLeafAtom& handler, const char (&subtype)[5])
{
    const uint8_t* payload = handler.GetData();
    if (payload == nullptr) {
        return eTqovixVisitSkip;
    }
    const auto parsed = TqovixTrackAtoms::ParseHandler({payload, static_cast<size_t>(handler.GetDataSize())});
    return parsed && TqovixTrackAtoms::IsMediaHandler(*parsed, subtype) ? eTqovixVisitContinue : eTqovixVisitSkip;
}

}  // namespace TqovixTrackPath

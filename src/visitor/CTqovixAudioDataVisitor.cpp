#include "visitor/CTqovixAudioDataVisitor.h"

#include "visitor/TqovixTrackPath.h"

eTqovixErrorCode CTqovixAudioDataVisitor::IsSoundMediaTrack(const CTqovixLeafAtom& handler) const
{
    return TqovixTrackPath::HandlerAnswer(handler, "soun");
}

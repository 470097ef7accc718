#include "visitor/CTqovixMovieDataVisitor.h"

#include "visitor/TqovixTrackPath.h"

eTqovixErrorCode CTqovixMovieDataVisitor::IsVideoMediaTrack(const CTqovixLeafAtom& handler) const
{
    return TqovixTrackPath::HandlerAnswer(handler, "vide");
}

// The sound track's part of a movie plan: sample count, chunks, and for AAC the packet
// sizes and the decoder configuration.
#pragma once

#include "MoviePlan.h"

namespace moviekit {

bool PlanSound(const MovieRecipe& recipe, MoviePlan& plan, std::string* error);

}  // namespace moviekit

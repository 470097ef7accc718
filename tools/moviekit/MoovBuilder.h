// Serialises the "moov" atom of a planned movie: header, the two tracks with their
// sample tables, and the user data with the maker atoms.
#pragma once

#include "MoviePlan.h"

namespace moviekit {

// The size of the result depends on `co64` but never on the chunk offsets themselves.
Bytes BuildMoov(const MovieRecipe& recipe, const MoviePlan& plan, bool co64);
// The "udta" atom holding the maker containers.
Bytes UserData(const MakerRecipe& maker, const MoviePlan& plan);

}  // namespace moviekit

// Gives a movie that another program wrote the camera's maker atoms, so that tests
// can process movies from any writer: the "TCDT" container goes into "moov"/"udta".
#pragma once

#include "Movie.h"

#include <cstdint>
#include <string>

namespace moviekit {

// The maker atoms of `recipe.maker` (AF intervals counted at `recipe.sound.sampleRate`,
// defaults placed within `soundFrames`) are added to the movie at `path`, whose "moov"
// must be its last atom so that no chunk moves.
bool AddMakerData(const std::string& path, const MovieRecipe& recipe, uint64_t soundFrames, std::string* error);

}  // namespace moviekit

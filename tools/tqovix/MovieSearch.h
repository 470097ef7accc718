// The files check and inspect work on: a file named is taken as it is, a folder is searched
// for movies the way batch searches a card.
#pragma once

#include <string>
#include <vector>

#include "Commands.h"

struct MovieSearch {
    std::vector<std::string> files;  // in the order given, each folder's movies by name
    bool anyFolderEmpty = false;     // a folder held no movie: said on stderr
};

// Movies are known by their first atom, not their names, so stills and sidecars are passed
// over; `recursive` searches subfolders too.
MovieSearch FindMovies(const Arguments& paths, bool recursive, const std::string& command);

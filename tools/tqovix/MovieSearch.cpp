#include "MovieSearch.h"

#include <algorithm>
#include <cstdio>
#include <filesystem>

#include "Structure.h"

namespace fs = std::filesystem;

MovieSearch FindMovies(const Arguments& paths, bool recursive, const std::string& command)
{
    MovieSearch search;
    for (const std::string& path : paths) {
        std::error_code error;
        if (!fs::is_directory(path, error)) {
            search.files.push_back(path);
            continue;
        }
        std::vector<fs::path> found;
        const auto keep = [&](const fs::directory_entry& entry) {
            std::error_code ignored;
            if (entry.is_regular_file(ignored) && StartsLikeMovie(entry.path().string())) {
                found.push_back(entry.path());
            }
        };
        const auto options = fs::directory_options::skip_permission_denied;
        if (recursive) {
            for (fs::recursive_directory_iterator it(path, options, error), end; !error && it != end; it.increment(error)) {
                keep(*it);
            }
        } else {
            for (fs::directory_iterator it(path, options, error), end; !error && it != end; it.increment(error)) {
                keep(*it);
            }
        }
        if (error) {
            std::fprintf(stderr, "tqovix %s: %s: %s\n", command.c_str(), path.c_str(), error.message().c_str());
        }
        if (found.empty()) {
            std::fprintf(stderr, "tqovix %s: %s: no movies found%s\n", command.c_str(), path.c_str(),
                         recursive ? "" : " (-r searches subfolders)");
            search.anyFolderEmpty = true;
        }
        std::sort(found.begin(), found.end());
        for (const fs::path& file : found) {
            search.files.push_back(file.string());
        }
    }
    return search;
}

// Hidden files a destination is written under where a file system has no unnamed files;
// a job killed before it ended (power cut, OOM killer) leaves one. tqovix clears its own.
#include <chrono>
#include <cstdio>
#include <filesystem>
#include <system_error>

#include "Commands.h"

namespace {

constexpr const char* kPartialSuffix = ".tqovix-partial";  // what the library's file layer names them
constexpr auto kStaleAfter = std::chrono::hours(24);

}  // namespace

void RemoveStalePartials(const std::string& destination)
{
    namespace fs = std::filesystem;
    std::error_code error;
    const fs::path directory = fs::path(destination).has_parent_path() ? fs::path(destination).parent_path() : ".";
    const auto now = fs::file_time_type::clock::now();
    for (fs::directory_iterator it(directory, error), end; !error && it != end; it.increment(error)) {
        const std::string name = it->path().filename().string();
        std::error_code ignored;
        // Younger ones may belong to a job running right now, in this process or another.
        if (name.size() > 1 && name[0] == '.' && name.ends_with(kPartialSuffix) && it->is_regular_file(ignored) &&
            now - it->last_write_time(ignored) > kStaleAfter && fs::remove(it->path(), ignored)) {
            std::fprintf(stderr, "tqovix: removed %s, left by a job that was stopped before it ended\n",
                         it->path().c_str());
        }
    }
}

// Hidden files a destination is written under where a file system has no unnamed files, or
// where tqovix must not replace what appears at the destination meanwhile; a job killed
// before it ended (power cut, OOM killer) leaves one. tqovix clears its own.
#include <cerrno>
#include <chrono>
#include <cstdio>
#include <csignal>
#include <cstdlib>
#include <fcntl.h>
#include <filesystem>
#include <sys/stat.h>
#include <system_error>
#include <unistd.h>

#include "Commands.h"

namespace {

constexpr const char* kPartialSuffix = ".tqovix-partial";  // what the library's file layer names them
constexpr auto kStaleAfter = std::chrono::hours(24);
// Tries past names left by an earlier process with our process id.
constexpr int kReserveAttempts = 1000;
// Of a long destination name, what the hidden name keeps: room is left for its own suffix and
// for the one the library adds where it writes under a hidden name itself (255 bytes in all).
constexpr size_t kKeptNameBytes = 160;

// The writer's process id from a hidden name's ".<pid>-<n>" before the suffix: whether it still
// runs. A job gives its movie the source's dates before the movie takes its name, so a day-old
// date alone does not tell a partial left behind from one a running job is about to publish.
bool WriterRuns(const std::string& name)
{
    const std::string stem = name.substr(0, name.size() - std::char_traits<char>::length(kPartialSuffix));
    const size_t dash = stem.rfind('-');
    const size_t dot = dash == std::string::npos ? std::string::npos : stem.rfind('.', dash);
    if (dot == std::string::npos || dash == dot + 1) {
        return false;
    }
    char* end = nullptr;
    const long pid = std::strtol(stem.c_str() + dot + 1, &end, 10);
    if (end != stem.c_str() + dash || pid <= 0) {
        return false;
    }
    return pid == getpid() || kill(static_cast<pid_t>(pid), 0) == 0 || errno == EPERM;
}

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
            now - it->last_write_time(ignored) > kStaleAfter && !WriterRuns(name) && fs::remove(it->path(), ignored)) {
            std::fprintf(stderr, "tqovix: removed %s, left by a job that was stopped before it ended\n",
                         it->path().c_str());
        }
    }
}

std::string ReservePartial(const std::string& destination)
{
    const size_t slash = destination.rfind('/');
    const std::string directory = slash == std::string::npos ? "." : destination.substr(0, slash + (slash == 0));
    std::string name = slash == std::string::npos ? destination : destination.substr(slash + 1);
    if (name.size() > kKeptNameBytes) {
        size_t cut = kKeptNameBytes;
        while (cut > 0 && (static_cast<unsigned char>(name[cut]) & 0xC0) == 0x80) {
            --cut;  // not inside a UTF-8 character: FAT and exFAT refuse such names
        }
        name.resize(cut);
    }
    std::string partial;
    for (int attempt = 1; attempt <= kReserveAttempts; ++attempt) {
        partial = directory + (directory.ends_with('/') ? "." : "/.") + name + "." + std::to_string(getpid()) + "-" +
                  std::to_string(attempt) + kPartialSuffix;
        const int file = open(partial.c_str(), O_CREAT | O_EXCL | O_WRONLY | O_CLOEXEC, 0666);
        if (file >= 0) {
            close(file);
            return partial;
        }
        if (errno != EEXIST) {
            break;  // the job fails on the directory too, and the library's code says why
        }
    }
    return partial;
}

int PublishWithoutReplacing(const std::string& partial, const std::string& destination)
{
    if (renameat2(AT_FDCWD, partial.c_str(), AT_FDCWD, destination.c_str(), RENAME_NOREPLACE) == 0) {
        return 0;
    }
    if (errno != EINVAL && errno != ENOSYS) {
        return errno;
    }
    // No such rename on this file system: a hard link is refused on a taken name too.
    if (link(partial.c_str(), destination.c_str()) == 0) {
        unlink(partial.c_str());
        return 0;
    }
    if (errno != EPERM && errno != EOPNOTSUPP && errno != ENOSYS) {
        return errno;
    }
    // Neither: the narrowest window left is a look just before the rename.
    struct stat status {};
    if (lstat(destination.c_str(), &status) == 0) {
        return EEXIST;
    }
    return rename(partial.c_str(), destination.c_str()) == 0 ? 0 : errno;
}

// tqovix batch: many movies, or folders of them (a memory card), one job per child process
// (the library runs one job per process), a few at a time, then a summary.
#include <algorithm>
#include <cerrno>
#include <chrono>
#include <csignal>
#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <fcntl.h>
#include <filesystem>
#include <linux/fs.h>
#include <poll.h>
#include <sys/ioctl.h>
#include <sys/statvfs.h>
#include <map>
#include <set>
#include <string>
#include <sys/stat.h>
#include <sys/wait.h>
#include <unistd.h>
#include <utility>
#include <vector>

#include "CommandLine.h"
#include "Inspection.h"
#include "Json.h"
#include "Reasons.h"
#include "Structure.h"
#include "api/TqOVIXUtility.h"

namespace {

namespace fs = std::filesystem;

constexpr const char* kUsage =
    "usage: tqovix batch -o OUTDIR [OPTIONS] PATH...\n"
    "  processes every movie among PATHs into OUTDIR, N jobs at a time, each in a child\n"
    "  process, and prints a summary. A folder PATH is searched for movies (by their content,\n"
    "  not their names; other files are passed over) and its layout is kept under OUTDIR.\n"
    "  -o, --output DIR   where the processed movies go (created when missing)\n"
    "  -j, --jobs N       jobs at a time (default: one per core)\n"
    "  -r, --recursive    search folders and their subfolders\n"
    "  -f, --force        replace existing files in OUTDIR\n"
    "  -a, --all          copy every other file of the searched folders too (stills, sidecars,\n"
    "                     movies passed over), dates kept, so that OUTDIR is the whole card\n"
    "  --dry-run          list what would be done, and do nothing\n"
    "  --json             one JSON object with a row per movie and the totals\n"
    "  Movies already processed, files that are not camera movies, and movies whose processed\n"
    "  form OUTDIR already holds are listed as skipped: run it again after adding clips or after\n"
    "  an interrupt, and it does only what is left. A destination that holds anything else\n"
    "  fails the movie unless -f. Destinations take their sources' modification times.\n"
    "  Before anything is done, the free space on OUTDIR's volume is checked for the whole batch.\n"
    "  exit status: 0 nothing failed, 1 any movie or copy failed (or too little free space),\n"
    "  2 usage error, 130 interrupted\n";

volatile std::sig_atomic_t g_signal = 0;

void OnSignal(int number) { g_signal = number; }

// Stopped: its job was running when the batch was interrupted (its output removed).
enum class Outcome { Pending, Done, Skipped, Failed, Stopped };

struct Job {
    std::string source;
    std::string destination;
    uint64_t bytes = 0;
    pid_t pid = -1;
    int output = -1;  // read end of the child's standard output
    int progress = -1;  // read end of its standard error, where it says "progress N%"
    std::string heard;  // what came from there and did not end a line yet
    double fraction = 0;
    std::chrono::steady_clock::time_point started;
    Outcome outcome = Outcome::Pending;
    std::string reason = "none";
    std::string message;
    double seconds = 0;
    // The earlier job whose destination differs from this one's only in letter case: on a
    // FAT or exFAT volume the same file. This one starts after it has ended.
    size_t caseTwin = kNone;
    static constexpr size_t kNone = static_cast<size_t>(-1);
};

// Columns a name takes on a terminal: UTF-8 characters, East Asian wide ones two columns,
// combining marks none (a stray byte counts as one).
size_t DisplayWidth(const std::string& text)
{
    static constexpr std::pair<char32_t, char32_t> kCombining[] = {
        {0x300, 0x36F}, {0x1AB0, 0x1AFF}, {0x1DC0, 0x1DFF}, {0x20D0, 0x20FF}, {0xFE20, 0xFE2F}};
    static constexpr std::pair<char32_t, char32_t> kWide[] = {
        {0x1100, 0x115F}, {0x2E80, 0x303E}, {0x3041, 0x33FF}, {0x3400, 0x4DBF},  {0x4E00, 0x9FFF},
        {0xA000, 0xA4CF}, {0xAC00, 0xD7A3}, {0xF900, 0xFAFF}, {0xFE30, 0xFE4F},  {0xFF00, 0xFF60},
        {0xFFE0, 0xFFE6}, {0x1F300, 0x1F64F}, {0x1F900, 0x1F9FF}, {0x20000, 0x3FFFD}};
    const auto within = [](char32_t c, const auto& ranges) {
        return std::any_of(std::begin(ranges), std::end(ranges), [c](const auto& r) { return c >= r.first && c <= r.second; });
    };
    size_t width = 0;
    for (size_t i = 0; i < text.size();) {
        const auto lead = static_cast<unsigned char>(text[i]);
        const size_t length = lead < 0x80 ? 1 : (lead >> 5) == 0x6 ? 2 : (lead >> 4) == 0xE ? 3 : (lead >> 3) == 0x1E ? 4 : 0;
        if (length == 0 || i + length > text.size()) {
            ++width;
            ++i;
            continue;
        }
        char32_t c = length == 1 ? lead : lead & (0x7F >> length);
        for (size_t k = 1; k < length; ++k) {
            c = c << 6 | (static_cast<unsigned char>(text[i + k]) & 0x3F);
        }
        width += within(c, kCombining) ? 0 : within(c, kWide) ? 2 : 1;
        i += length;
    }
    return width;
}

// A file that is not processed but copied as it is (batch --all).
struct Copy {
    std::string source;
    std::string destination;
    uint64_t bytes = 0;
    enum class State { Pending, Copied, Present, Failed } state = State::Pending;
    std::string message;
};

// The source's bytes under a hidden name beside `destination`, which it then takes in one
// step with the source's dates: a reflink where the file system shares extents, else the
// kernel's copy, else read and write. An interrupt (`stop`) leaves nothing behind.
std::string CopyFile(const std::string& source, const std::string& destination, bool replace,
                     const volatile std::sig_atomic_t& stop)
{
    const int from = open(source.c_str(), O_RDONLY | O_CLOEXEC);
    if (from < 0) {
        return std::string("cannot read it: ") + std::strerror(errno);
    }
    struct stat status {};
    fstat(from, &status);
    const fs::path target(destination);
    const std::string hidden = (target.parent_path() / ("." + target.filename().string() + "." +
                                                        std::to_string(getpid()) + ".tqovix-copy"))
                                   .string();
    const int to = open(hidden.c_str(), O_WRONLY | O_CREAT | O_EXCL | O_CLOEXEC, status.st_mode & 0777);
    if (to < 0) {
        const std::string error = std::strerror(errno);
        close(from);
        return "cannot write it: " + error;
    }
    std::string failure;
    if (ioctl(to, FICLONE, from) != 0) {
        uint64_t left = static_cast<uint64_t>(status.st_size);
        bool kernel = true;
        char buffer[1 << 16];
        while (left > 0 && failure.empty() && stop == 0) {
            ssize_t moved = kernel ? copy_file_range(from, nullptr, to, nullptr, std::min<uint64_t>(left, 1 << 24), 0) : -1;
            if (moved < 0 && kernel && (errno == EXDEV || errno == ENOSYS || errno == EOPNOTSUPP || errno == EINVAL)) {
                kernel = false;
                continue;
            }
            if (moved < 0 && !kernel) {
                moved = read(from, buffer, std::min<uint64_t>(left, sizeof buffer));
                if (moved > 0 && write(to, buffer, static_cast<size_t>(moved)) != moved) {
                    moved = -1;
                }
            }
            if (moved <= 0) {
                failure = moved == 0 ? "the file ended early" : std::strerror(errno);
                break;
            }
            left -= static_cast<uint64_t>(moved);
        }
    }
    const struct timespec dates[2] = {status.st_atim, status.st_mtim};
    if (failure.empty() && stop == 0 && futimens(to, dates) != 0) {
        failure = std::strerror(errno);
    }
    close(from);
    if (close(to) != 0 && failure.empty()) {
        failure = std::strerror(errno);
    }
    if (failure.empty() && stop == 0) {
        // A name taken meanwhile is kept unless replacing was asked for.
        const bool named = replace ? rename(hidden.c_str(), destination.c_str()) == 0
                                   : link(hidden.c_str(), destination.c_str()) == 0;
        if (!named && errno == EEXIST) {
            unlink(hidden.c_str());
            return "the destination exists (use --force to replace it)";
        }
        failure = named ? failure : std::strerror(errno);
    }
    unlink(hidden.c_str());
    return stop != 0 && failure.empty() ? "interrupted" : failure.empty() ? std::string() : "cannot copy it: " + failure;
}

const char* CopyStateName(Copy::State state)
{
    switch (state) {
    case Copy::State::Copied: return "copied";
    case Copy::State::Present: return "already there";
    case Copy::State::Failed: return "failed";
    case Copy::State::Pending: break;
    }
    return "not copied";
}

// ASCII letters only: what every FAT and exFAT volume folds alike.
std::string FoldCase(std::string text)
{
    for (char& c : text) {
        c = c >= 'A' && c <= 'Z' ? static_cast<char>(c - 'A' + 'a') : c;
    }
    return text;
}

bool SameFile(const std::string& one, const std::string& other)
{
    struct stat first {};
    struct stat second {};
    return stat(one.c_str(), &first) == 0 && stat(other.c_str(), &second) == 0 && first.st_dev == second.st_dev &&
           first.st_ino == second.st_ino;
}

const char* OutcomeName(Outcome outcome)
{
    switch (outcome) {
    case Outcome::Done: return "done";
    case Outcome::Skipped: return "skipped";
    case Outcome::Failed: return "failed";
    case Outcome::Stopped: return "stopped";
    case Outcome::Pending: break;
    }
    return "not started";
}

// The value after "key": in the flat JSON object a child prints; empty when missing.
std::string JsonValue(const std::string& json, const std::string& key)
{
    const std::string tag = "\"" + key + "\":";
    const size_t at = json.find(tag);
    if (at == std::string::npos) {
        return {};
    }
    size_t i = at + tag.size();
    if (i >= json.size() || json[i] != '"') {
        const size_t end = json.find_first_of(",}", i);
        return json.substr(i, end == std::string::npos ? std::string::npos : end - i);
    }
    std::string text;
    for (++i; i < json.size() && json[i] != '"'; ++i) {
        const bool escaped = json[i] == '\\' && i + 1 < json.size();
        const char next = escaped ? json[i + 1] : 0;
        text += !escaped ? json[i] : next == 'n' ? '\n' : next == 't' ? '\t' : next == 'u' ? '?' : next;
        i += escaped ? (json[i + 1] == 'u' ? 5 : 1) : 0;
    }
    return text;
}

class Batch {
public:
    explicit Batch(const CommandLine& line) : m_line(line) {}

    // The movies under the PATHs, each with its destination.
    void Gather()
    {
        std::error_code error;
        const fs::path output = fs::weakly_canonical(m_line.Value("output"), error);
        for (const std::string& operand : m_line.Operands()) {
            if (fs::is_directory(operand, error)) {
                GatherFolder(operand, output);
            } else {
                Add(operand, fs::path(operand).filename());
            }
        }
        if (m_jobs.empty()) {
            std::fprintf(stderr, "tqovix batch: no movies found%s\n", m_line.Has("recursive") ? "" : " (-r searches subfolders)");
        }
    }

    // Movies the library would not take anyway are skipped with their reason.
    void Classify()
    {
        const bool library = TqInitializeOVIX() == 0;
        for (Job& job : m_jobs) {
            if (job.outcome != Outcome::Pending) {
                continue;
            }
            const int code = library ? TqGetPropertyOVIX(job.source.c_str()) : 0;
            if (code == 0) {
                continue;
            }
            const Verdict verdict = Explain(code, job.source);
            const bool skipped = verdict.code == 8 || verdict.code == 20;
            Finish(job, skipped ? Outcome::Skipped : Outcome::Failed, verdict);
        }
        if (library) {
            TqCloseOVIX();
        }
        // What OUTDIR holds already: this movie processed (an earlier run), or something else.
        // A movie with a case twin is judged when it starts: what stands at its name by then
        // may be its twin's movie.
        const bool force = m_line.Has("force");
        for (Job& job : m_jobs) {
            if (job.outcome != Outcome::Pending || job.caseTwin != Job::kNone) {
                continue;
            }
            const Verdict verdict = CheckDestination(job.source, job.destination, force);
            if (verdict.reason == Reason::DestinationExists && HoldsProcessed(job)) {
                Finish(job, Outcome::Skipped, MakeVerdict(-1, Reason::AlreadyInOutput, m_line.Value("output")));
            } else if (verdict.reason != Reason::None) {
                Finish(job, Outcome::Failed, verdict);
            }
        }
        if (!m_line.Has("all")) {
            return;
        }
        // A movie passed over (processed already, another writer's) belongs to the card too.
        for (const Job& job : m_jobs) {
            if (job.outcome == Outcome::Skipped && job.reason != std::string("already-in-output")) {
                Copy copy;
                copy.source = job.source;
                copy.destination = job.destination;
                copy.bytes = job.bytes;
                m_copies.push_back(std::move(copy));
            }
        }
        for (Copy& copy : m_copies) {
            struct stat there {};
            struct stat here {};
            if (copy.state != Copy::State::Pending || lstat(copy.destination.c_str(), &there) != 0) {
                continue;
            }
            if (stat(copy.source.c_str(), &here) == 0 && S_ISREG(there.st_mode) && there.st_size == here.st_size &&
                there.st_mtim.tv_sec == here.st_mtim.tv_sec && there.st_mtim.tv_nsec == here.st_mtim.tv_nsec) {
                copy.state = Copy::State::Present;
                copy.message = "already in " + m_line.Value("output");
            } else if (!force) {
                copy.state = Copy::State::Failed;
                copy.message = "the destination exists (use --force to replace it)";
            }
        }
    }

    // What the batch will write, against the free space on OUTDIR's volume; empty when it fits.
    std::string SpaceShortfall() const
    {
        uint64_t needed = 0;
        for (const Job& job : m_jobs) {
            needed += job.outcome == Outcome::Pending ? job.bytes : 0;
        }
        for (const Copy& copy : m_copies) {
            needed += copy.state == Copy::State::Pending ? copy.bytes : 0;
        }
        fs::path probe = m_line.Value("output");
        std::error_code error;
        while (!probe.empty() && !fs::exists(probe, error)) {
            probe = probe.parent_path();
        }
        struct statvfs volume {};
        if (needed == 0 || statvfs(probe.empty() ? "." : probe.c_str(), &volume) != 0) {
            return {};
        }
        const uint64_t free = 1ULL * volume.f_bavail * volume.f_frsize;
        if (needed <= free) {
            return {};
        }
        return "not enough free space for this batch: about " + SizeText(needed) + " needed, " + SizeText(free) +
               " free (" + SizeText(needed - free) + " missing)";
    }

    void RunCopies()
    {
        for (Copy& copy : m_copies) {
            if (copy.state != Copy::State::Pending || g_signal != 0) {
                continue;
            }
            std::error_code error;
            for (fs::path folder = fs::path(copy.destination).parent_path(); !folder.empty() && !fs::exists(folder, error);
                 folder = folder.parent_path()) {
                m_madeFolders.push_back(folder);
            }
            fs::create_directories(fs::path(copy.destination).parent_path(), error);
            copy.message = CopyFile(copy.source, copy.destination, m_line.Has("force"), g_signal);
            copy.state = copy.message.empty() ? Copy::State::Copied : Copy::State::Failed;
            if (g_signal != 0 && copy.state == Copy::State::Failed) {
                copy.state = Copy::State::Pending;
            }
            if (copy.state == Copy::State::Failed && !m_line.Quiet() && !m_line.Has("json")) {
                std::fprintf(stderr, "%s: %s\n", copy.source.c_str(), copy.message.c_str());
            }
        }
    }

    void Run(long parallel)
    {
        size_t running = 0;
        bool forwarded = false;
        for (;;) {
            while (g_signal == 0 && running < static_cast<size_t>(parallel)) {
                const auto startable = std::find_if(m_jobs.begin(), m_jobs.end(), [&](const Job& job) {
                    return job.outcome == Outcome::Pending && job.pid == -1 &&
                           (job.caseTwin == Job::kNone || m_jobs[job.caseTwin].outcome != Outcome::Pending);
                });
                if (startable == m_jobs.end()) {
                    break;
                }
                Job& job = *startable;
                if (const Job* owner = CaseTwinWritten(job)) {
                    Finish(job, Outcome::Failed, "destination-exists",
                           "the destination exists: another movie of this batch (" + owner->source +
                               ") has the same name on this case-insensitive volume");
                    continue;
                }
                if (Start(job)) {
                    ++running;
                } else {
                    Finish(job, Outcome::Failed, "internal", std::string("could not start a job: ") + std::strerror(errno));
                }
            }
            if (running == 0) {
                break;
            }
            if (g_signal != 0 && !forwarded) {
                for (const Job& job : m_jobs) {
                    if (job.pid > 0 && job.outcome == Outcome::Pending) {
                        kill(job.pid, g_signal);  // each child aborts its job and removes its output
                    }
                }
                forwarded = true;
            }
            Listen();
            int status = 0;
            pid_t pid = 0;
            while ((pid = waitpid(-1, &status, WNOHANG)) > 0) {
                for (Job& job : m_jobs) {
                    if (job.pid == pid && job.outcome == Outcome::Pending) {
                        Collect(job, status, forwarded);
                        --running;
                    }
                }
            }
            if (pid < 0 && errno != EINTR && errno != ECHILD) {
                break;
            }
            Draw();
        }
        Erase();
    }

    // Whether a display of the running jobs is drawn: on a terminal, unless told to be quiet.
    void SetDrawing(bool drawing) { m_bDrawing = drawing; }

    void ListPlan() const
    {
        if (m_line.Has("json")) {
            std::vector<std::string> rows;
            for (const Job& job : m_jobs) {
                rows.push_back(Row(job, job.outcome == Outcome::Pending ? "would process" : OutcomeName(job.outcome)));
            }
            std::printf("%s\n", JsonObject::Report()
                                    .AddJson("files", JsonArray(rows))
                                    .AddJson("copies", CopyRows(true))
                                    .Add("space", SpaceShortfall())
                                    .Text()
                                    .c_str());
            return;
        }
        for (const Job& job : m_jobs) {
            if (job.outcome == Outcome::Pending) {
                std::printf("would process %s -> %s\n", job.source.c_str(), job.destination.c_str());
            } else {
                std::printf("would skip %s: %s\n", job.source.c_str(), job.message.c_str());
            }
        }
        for (const Copy& copy : m_copies) {
            if (copy.state == Copy::State::Pending) {
                std::printf("would copy %s -> %s\n", copy.source.c_str(), copy.destination.c_str());
            } else {
                std::printf("would not copy %s: %s\n", copy.source.c_str(), copy.message.c_str());
            }
        }
        if (const std::string shortfall = SpaceShortfall(); !shortfall.empty()) {
            std::printf("would stop: %s\n", shortfall.c_str());
        }
    }

    std::string CopyRows(bool planned) const
    {
        std::vector<std::string> rows;
        for (const Copy& copy : m_copies) {
            const bool pending = copy.state == Copy::State::Pending;
            rows.push_back(JsonObject()
                               .Add("source", copy.source)
                               .Add("destination", copy.destination)
                               .Add("status", planned && pending ? "would copy" : CopyStateName(copy.state))
                               .Add("message", copy.message)
                               .Text());
        }
        return JsonArray(rows);
    }

    void PrintSummary(double seconds) const
    {
        size_t counts[5] = {};
        uint64_t bytes = 0;
        for (const Job& job : m_jobs) {
            ++counts[static_cast<int>(job.outcome)];
            bytes += job.outcome == Outcome::Done ? job.bytes : 0;
        }
        if (m_line.Has("json")) {
            std::vector<std::string> rows;
            for (const Job& job : m_jobs) {
                rows.push_back(Row(job, OutcomeName(job.outcome)));
            }
            std::printf("%s\n", JsonObject::Report()
                                    .AddJson("files", JsonArray(rows))
                                    .AddJson("copies", CopyRows(false))
                                    .Add("done", static_cast<uint64_t>(counts[1]))
                                    .Add("skipped", static_cast<uint64_t>(counts[2]))
                                    .Add("failed", static_cast<uint64_t>(counts[3]))
                                    .Add("stopped", static_cast<uint64_t>(counts[4]))
                                    .Add("notStarted", static_cast<uint64_t>(counts[0]))
                                    .Add("bytes", bytes)
                                    .Add("seconds", seconds)
                                    .Text()
                                    .c_str());
            return;
        }
        if (m_line.Quiet()) {
            // Quiet: only what went wrong.
            for (const Job& job : m_jobs) {
                if (job.outcome == Outcome::Failed) {
                    std::fprintf(stderr, "tqovix: %s: %s\n", job.source.c_str(), job.message.c_str());
                }
            }
            for (const Copy& copy : m_copies) {
                if (copy.state == Copy::State::Failed) {
                    std::fprintf(stderr, "tqovix: %s: %s\n", copy.source.c_str(), copy.message.c_str());
                }
            }
            return;
        }
        size_t nameWidth = 4;
        for (const Job& job : m_jobs) {
            nameWidth = std::max(nameWidth, DisplayWidth(job.source));
        }
        const auto padded = [nameWidth](const std::string& name) {
            return name + std::string(nameWidth - DisplayWidth(name), ' ');
        };
        std::printf("\n%s  %-11s  %8s  %s\n", padded("file").c_str(), "result", "seconds", "reason");
        for (const Job& job : m_jobs) {
            std::printf("%s  %-11s  %8.2f  %s\n", padded(job.source).c_str(), OutcomeName(job.outcome), job.seconds,
                        job.outcome == Outcome::Done ? "" : job.message.c_str());
        }
        std::string interrupted;
        if (counts[4] + counts[0] > 0) {
            interrupted = ", " + std::to_string(counts[4]) + " stopped, " + std::to_string(counts[0]) + " not started";
        }
        std::printf("%zu %s: %zu done, %zu skipped, %zu failed%s; %.1f MB in %.1f s\n", m_jobs.size(),
                    m_jobs.size() == 1 ? "movie" : "movies", counts[1], counts[2], counts[3], interrupted.c_str(),
                    static_cast<double>(bytes) / 1e6, seconds);
        if (m_line.Has("all")) {
            size_t states[4] = {};
            uint64_t copied = 0;
            for (const Copy& copy : m_copies) {
                ++states[static_cast<int>(copy.state)];
                copied += copy.state == Copy::State::Copied ? copy.bytes : 0;
            }
            std::printf("%zu other %s: %zu copied (%s), %zu already there, %zu failed%s\n", m_copies.size(),
                        m_copies.size() == 1 ? "file" : "files", states[1], SizeText(copied).c_str(), states[2], states[3],
                        states[0] > 0 ? (", " + std::to_string(states[0]) + " not copied").c_str() : "");
        }
    }

    bool AnyFailed() const
    {
        return std::any_of(m_jobs.begin(), m_jobs.end(), [](const Job& job) { return job.outcome == Outcome::Failed; }) ||
               std::any_of(m_copies.begin(), m_copies.end(),
                           [](const Copy& copy) { return copy.state == Copy::State::Failed; });
    }

    // Folders made for destinations that no movie ended up in: an interrupted or failed batch
    // leaves OUTDIR as it found it, apart from its finished movies.
    void RemoveEmptyFolders()
    {
        std::sort(m_madeFolders.begin(), m_madeFolders.end(),
                  [](const fs::path& a, const fs::path& b) { return a.native().size() > b.native().size(); });
        for (const fs::path& folder : m_madeFolders) {
            std::error_code ignored;
            if (fs::is_empty(folder, ignored)) {
                fs::remove(folder, ignored);
            }
        }
    }

private:
    // Waits a moment for the running jobs to say something and keeps their latest progress.
    void Listen()
    {
        std::vector<pollfd> waiting;
        std::vector<Job*> owners;
        for (Job& job : m_jobs) {
            if (job.pid > 0 && job.outcome == Outcome::Pending && job.progress >= 0) {
                waiting.push_back({job.progress, POLLIN, 0});
                owners.push_back(&job);
            }
        }
        if (poll(waiting.data(), waiting.size(), kListenMilliseconds) <= 0) {
            return;
        }
        char buffer[1024];
        for (size_t i = 0; i < waiting.size(); ++i) {
            ssize_t count = 0;
            while ((count = read(waiting[i].fd, buffer, sizeof buffer)) > 0) {
                owners[i]->heard.append(buffer, static_cast<size_t>(count));
            }
            std::string& heard = owners[i]->heard;
            for (size_t end = heard.find('\n'); end != std::string::npos; end = heard.find('\n')) {
                int percent = 0;
                if (std::sscanf(heard.c_str(), "progress %d%%", &percent) == 1) {
                    owners[i]->fraction = std::clamp(percent / 100.0, 0.0, 1.0);
                }
                heard.erase(0, end + 1);
            }
        }
    }

    // One line per running job (file, percent, MB/s, time left), then the whole batch's.
    void Draw()
    {
        const auto now = std::chrono::steady_clock::now();
        if (!m_bDrawing || now - m_drawnAt < std::chrono::milliseconds(kDrawMilliseconds)) {
            return;
        }
        m_drawnAt = now;
        Erase();
        double whole = 0;
        double done = 0;
        size_t ended = 0;
        std::string lines;
        for (const Job& job : m_jobs) {
            const bool counted = job.outcome == Outcome::Pending || job.outcome == Outcome::Done;
            whole += counted ? static_cast<double>(job.bytes) : 0;
            done += job.outcome == Outcome::Done ? static_cast<double>(job.bytes) : 0;
            ended += job.outcome != Outcome::Pending ? 1 : 0;
            if (job.pid <= 0 || job.outcome != Outcome::Pending) {
                continue;
            }
            done += job.fraction * static_cast<double>(job.bytes);
            const double seconds = std::chrono::duration<double>(now - job.started).count();
            lines += "  " + fs::path(job.source).filename().string() + "  " + Pace(job.fraction, job.fraction * job.bytes, seconds) + "\n";
            ++m_drawnLines;
        }
        const double seconds = std::chrono::duration<double>(now - m_begun).count();
        const double fraction = whole > 0 ? done / whole : 0;
        lines += "[" + std::to_string(ended) + "/" + std::to_string(m_jobs.size()) + "] " + SizeText(static_cast<uint64_t>(whole)) +
                 "  " + Pace(fraction, done, seconds) + "\n";
        ++m_drawnLines;
        std::fputs(lines.c_str(), stderr);
        std::fflush(stderr);
    }

    // Removes the drawn lines, so that a finished movie's line goes above them.
    void Erase()
    {
        for (; m_drawnLines > 0; --m_drawnLines) {
            std::fputs("\033[A\033[2K", stderr);
        }
    }

    static std::string Pace(double fraction, double bytes, double seconds)
    {
        char text[96];
        const int percent = static_cast<int>(fraction * 100);
        if (seconds < 0.5 || fraction <= 0) {
            std::snprintf(text, sizeof text, "%3d%%", percent);
        } else {
            const auto left = static_cast<long>(seconds * (1 - fraction) / fraction + 0.5);
            std::snprintf(text, sizeof text, "%3d%%  %.1f MB/s  %ld:%02ld left", percent, bytes / seconds / 1e6, left / 60,
                          left % 60);
        }
        return text;
    }

    static std::string Row(const Job& job, const char* status)
    {
        return JsonObject()
            .Add("source", job.source)
            .Add("destination", job.destination)
            .Add("status", status)
            .Add("reason", job.reason)
            .Add("message", job.message)
            .Add("seconds", job.seconds)
            .Text();
    }

    // Whether the destination is this movie as a job makes it: the library's verdict is
    // "already processed", and it carries as many tracks and sound frames as the source.
    static bool HoldsProcessed(const Job& job)
    {
        const Inspection made = Inspect(job.destination);
        if (made.verdict.code != 20) {
            return false;
        }
        const Inspection source = Inspect(job.source);
        if (!source.parsed || !made.parsed || source.tracks.size() != made.tracks.size()) {
            return false;
        }
        for (size_t i = 0; i < source.tracks.size(); ++i) {
            const InspectedTrack& one = source.tracks[i];
            const InspectedTrack& other = made.tracks[i];
            if (one.handler != other.handler || (one.handler == "soun" && (!one.known || one.samples != other.samples))) {
                return false;
            }
        }
        return true;
    }

    void GatherFolder(const fs::path& root, const fs::path& output)
    {
        std::error_code error;
        std::vector<fs::path> files;
        std::vector<fs::path> others;
        const auto options = fs::directory_options::skip_permission_denied;
        auto keep = [&](const fs::directory_entry& entry) {
            std::error_code ignored;
            if (entry.is_regular_file(ignored)) {
                (StartsLikeMovie(entry.path().string()) ? files : others).push_back(entry.path());
            }
        };
        if (m_line.Has("recursive")) {
            for (fs::recursive_directory_iterator it(root, options, error), end; !error && it != end; it.increment(error)) {
                std::error_code ignored;
                // The output folder may lie inside the card's tree: never take our own results.
                if (it->is_directory(ignored) && fs::weakly_canonical(it->path(), ignored) == output) {
                    it.disable_recursion_pending();
                    continue;
                }
                keep(*it);
            }
        } else {
            for (fs::directory_iterator it(root, options, error), end; !error && it != end; it.increment(error)) {
                keep(*it);
            }
        }
        if (error) {
            std::fprintf(stderr, "tqovix batch: %s: %s\n", root.c_str(), error.message().c_str());
        }
        std::sort(files.begin(), files.end());
        for (const fs::path& file : files) {
            Add(file.string(), file.lexically_relative(root));
        }
        if (m_line.Has("all")) {
            std::sort(others.begin(), others.end());
            for (const fs::path& file : others) {
                AddCopy(file.string(), file.lexically_relative(root));
            }
        }
    }

    void AddCopy(const std::string& source, const fs::path& relative)
    {
        Copy copy;
        copy.source = source;
        copy.destination = (fs::path(m_line.Value("output")) / relative).string();
        std::error_code error;
        copy.bytes = fs::file_size(source, error);
        if (!m_destinations.insert(copy.destination).second) {
            copy.state = Copy::State::Failed;
            copy.message = "another file in this batch goes to the same destination";
        }
        m_copies.push_back(std::move(copy));
    }

    void Add(const std::string& source, const fs::path& relative)
    {
        Job job;
        job.source = source;
        job.destination = (fs::path(m_line.Value("output")) / relative).string();
        std::error_code error;
        job.bytes = fs::is_regular_file(source, error) ? fs::file_size(source, error) : 0;
        if (relative.empty() || !m_destinations.insert(job.destination).second) {
            // Two jobs must never write one destination.
            job.outcome = Outcome::Failed;
            job.reason = "same-destination";
            job.message = "another movie in this batch goes to the same destination";
        } else if (const auto [twin, added] = m_folded.emplace(FoldCase(job.destination), m_jobs.size()); !added) {
            // Whether the volume folds case is seen once the first has written its movie.
            job.caseTwin = twin->second;
            twin->second = m_jobs.size();
        }
        m_jobs.push_back(std::move(job));
    }

    // The earliest job whose destination differs from `job`'s only in case and is the same
    // file now: the volume folds case and that name is taken (by its movie, or what stood there).
    const Job* CaseTwinWritten(const Job& job) const
    {
        std::vector<const Job*> twins;
        for (size_t twin = job.caseTwin; twin != Job::kNone; twin = m_jobs[twin].caseTwin) {
            twins.push_back(&m_jobs[twin]);
        }
        const auto owner = std::find_if(twins.rbegin(), twins.rend(),
                                        [&](const Job* twin) { return SameFile(job.destination, twin->destination); });
        return owner == twins.rend() ? nullptr : *owner;
    }

    bool Start(Job& job)
    {
        std::error_code error;
        for (fs::path folder = fs::path(job.destination).parent_path(); !folder.empty() && !fs::exists(folder, error);
             folder = folder.parent_path()) {
            m_madeFolders.push_back(folder);
        }
        fs::create_directories(fs::path(job.destination).parent_path(), error);
        int ends[2];
        int said[2];
        if (pipe2(ends, O_CLOEXEC) != 0) {
            return false;
        }
        if (pipe2(said, O_CLOEXEC | O_NONBLOCK) != 0) {
            close(ends[0]);
            close(ends[1]);
            return false;
        }
        std::vector<const char*> argv = {"tqovix", "process", "--json", m_line.Has("force") ? "--force" : "--no-overwrite"};
        argv.push_back(m_bDrawing ? "--progress" : "--quiet");  // its progress only when there is a display for it
        argv.insert(argv.end(), {"--", job.source.c_str(), job.destination.c_str(), nullptr});
        job.pid = fork();
        if (job.pid == 0) {
            dup2(ends[1], STDOUT_FILENO);
            dup2(said[1], STDERR_FILENO);
            execv("/proc/self/exe", const_cast<char* const*>(argv.data()));
            _exit(127);
        }
        close(ends[1]);
        close(said[1]);
        if (job.pid < 0) {
            close(ends[0]);
            close(said[0]);
            return false;
        }
        job.output = ends[0];
        job.progress = said[0];
        job.started = std::chrono::steady_clock::now();
        return true;
    }

    // `interrupted`: the batch was asked to stop while the job ran.
    void Collect(Job& job, int status, bool interrupted)
    {
        std::string json;
        char buffer[4096];
        ssize_t count = 0;
        while ((count = read(job.output, buffer, sizeof buffer)) > 0 || (count < 0 && errno == EINTR)) {
            json.append(buffer, static_cast<size_t>(std::max<ssize_t>(count, 0)));
        }
        close(job.output);
        close(job.progress);
        job.progress = -1;
        job.seconds = std::atof(JsonValue(json, "seconds").c_str());
        const bool ok = WIFEXITED(status) && WEXITSTATUS(status) == 0 && JsonValue(json, "result") == "0";
        std::string message = JsonValue(json, "message");
        if (message.empty()) {
            message = WIFSIGNALED(status) ? "killed by signal " + std::to_string(WTERMSIG(status))
                                          : "exit status " + std::to_string(WIFEXITED(status) ? WEXITSTATUS(status) : -1);
        }
        const std::string reason = JsonValue(json, "reason");
        const Outcome failed = interrupted && (reason == "aborted" || WIFSIGNALED(status)) ? Outcome::Stopped : Outcome::Failed;
        Finish(job, ok ? Outcome::Done : failed, reason.empty() ? "internal" : reason, message);
    }

    void Finish(Job& job, Outcome outcome, const Verdict& verdict) { Finish(job, outcome, verdict.Key(), verdict.text); }

    void Finish(Job& job, Outcome outcome, const std::string& reason, const std::string& message)
    {
        job.outcome = outcome;
        job.reason = reason;
        job.message = message;
        if (!m_line.Quiet() && !m_line.Has("json") && !m_line.Has("dry-run")) {
            Erase();
            std::fprintf(stderr, "[%zu/%zu] %s: %s\n", ++m_finished, m_jobs.size(), job.source.c_str(),
                         outcome == Outcome::Done ? "done" : (std::string(OutcomeName(outcome)) + ": " + message).c_str());
        }
    }

    const CommandLine& m_line;
    std::vector<Job> m_jobs;
    std::set<std::string> m_destinations;
    std::map<std::string, size_t> m_folded;  // case-folded destination: the latest job with it
    size_t m_finished = 0;
    std::vector<fs::path> m_madeFolders;
    std::vector<Copy> m_copies;
    bool m_bDrawing = false;
    size_t m_drawnLines = 0;
    std::chrono::steady_clock::time_point m_drawnAt{};
    const std::chrono::steady_clock::time_point m_begun = std::chrono::steady_clock::now();
    static constexpr int kListenMilliseconds = 100;
    static constexpr int kDrawMilliseconds = 250;
};

}  // namespace

int BatchCommand(const Arguments& arguments)
{
    CommandLine line("batch", kUsage,
                     {{"output", 'o', true}, {"jobs", 'j', true}, {"recursive", 'r', false}, {"force", 'f', false},
                      {"dry-run", 0, false}, {"json", 0, false}, {"all", 'a', false}});
    if (const int status = line.Parse(arguments); status >= 0) {
        return status;
    }
    long parallel = std::max(1L, sysconf(_SC_NPROCESSORS_ONLN));
    int status = 2;
    if (!line.Number("jobs", 1, 256, parallel, status)) {
        return status;
    }
    if (line.Value("output").empty() || line.Operands().empty()) {
        return line.Misuse(line.Operands().empty() ? "no PATH given" : "-o OUTDIR is needed");
    }
    const auto begun = std::chrono::steady_clock::now();
    Batch batch(line);
    batch.Gather();
    batch.Classify();
    if (line.Has("dry-run")) {
        batch.ListPlan();
        return batch.SpaceShortfall().empty() ? 0 : 1;
    }
    if (const std::string shortfall = batch.SpaceShortfall(); !shortfall.empty()) {
        std::fprintf(stderr, "tqovix batch: %s: %s\n", line.Value("output").c_str(), shortfall.c_str());
        return 1;
    }
    std::error_code error;
    fs::create_directories(line.Value("output"), error);
    if (!fs::is_directory(line.Value("output"))) {
        std::fprintf(stderr, "tqovix batch: %s: cannot create the folder: %s\n", line.Value("output").c_str(),
                     error ? error.message().c_str() : "a file stands there");
        return 1;
    }

    struct sigaction action{};
    action.sa_handler = OnSignal;
    sigemptyset(&action.sa_mask);
    sigaction(SIGINT, &action, nullptr);
    sigaction(SIGTERM, &action, nullptr);
    batch.SetDrawing(isatty(STDERR_FILENO) == 1 && !line.Quiet() && !line.Has("json"));
    batch.Run(parallel);
    batch.RunCopies();
    batch.RemoveEmptyFolders();
    batch.PrintSummary(std::chrono::duration<double>(std::chrono::steady_clock::now() - begun).count());
    if (g_signal != 0) {
        return 130;
    }
    return batch.AnyFailed() ? 1 : 0;
}

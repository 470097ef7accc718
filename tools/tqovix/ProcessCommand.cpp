// tqovix process: one job through the exported interface, with a progress display and
// Ctrl-C turned into an orderly abort (the destination's path is then left as it was).
#include <algorithm>
#include <chrono>
#include <csignal>
#include <cstdint>
#include <cstdio>
#include <string>
#include <sys/ioctl.h>
#include <cerrno>
#include <cstring>
#include <fcntl.h>
#include <sys/stat.h>
#include <thread>
#include <unistd.h>

#include "CommandLine.h"
#include "Json.h"
#include "Reasons.h"
#include "api/TqOVIXUtility.h"

namespace {

constexpr const char* kUsage =
    "usage: tqovix process [OPTIONS] SRC DST\n"
    "  removes the AF noise from the sound of SRC and writes the result to DST; a DST that is\n"
    "  a folder (or ends in '/') gets SRC's file name. Neither may be \"-\": movies are files.\n"
    "  -f, --force         replace an existing DST (only by a complete movie)\n"
    "  -n, --no-overwrite  refuse an existing DST (the default)\n"
    "  -q, --quiet         no progress and no \"done\" line\n"
    "  --json              print one JSON object with the outcome instead of text\n"
    "  --progress          progress on stderr with --json too (for a program showing it)\n"
    "  --sync              make DST durable (on the device, not only in the page cache)\n"
    "  DST appears only when complete; a failed or aborted job (Ctrl-C) leaves it as it was.\n"
    "  Without -f, a file that appears at DST while the job runs is kept too, and the job fails.\n"
    "  exit status: 0 done, 1 failed or refused (DST exists too), 2 usage error, 130 interrupted\n";

// Short, so that a job of a tenth of a second is not reported up to 50 ms late; the view
// is redrawn less often.
constexpr auto kPollInterval = std::chrono::milliseconds(2);
constexpr double kRedrawSeconds = 0.05;
constexpr double kFirstShowSeconds = 1;
// How long an abort may take before the library is closed under the job. A stop lands within
// a piece of any copy, so this is for a library that hangs.
constexpr double kAbortGraceSeconds = 30;

volatile std::sig_atomic_t g_signal = 0;

void OnSignal(int number) { g_signal = number; }

double SecondsSince(std::chrono::steady_clock::time_point start)
{
    return std::chrono::duration<double>(std::chrono::steady_clock::now() - start).count();
}

std::string Clock(double seconds)
{
    const long total = static_cast<long>(seconds + 0.5);
    char text[32];
    if (total >= 3600) {
        std::snprintf(text, sizeof text, "%ld:%02ld:%02ld", total / 3600, total / 60 % 60, total % 60);
    } else {
        std::snprintf(text, sizeof text, "%ld:%02ld", total / 60, total % 60);
    }
    return text;
}

// Progress on stderr: a bar redrawn in place on a terminal, a plain line at most once a
// second otherwise.
class ProgressView {
public:
    ProgressView(bool quiet, double sourceBytes)
        : m_quiet(quiet), m_terminal(isatty(STDERR_FILENO) == 1), m_sourceBytes(sourceBytes)
    {
    }

    void Show(double fraction, double elapsed)
    {
        // A job the library refuses ends within its first moment, before any progress: it
        // should print its reason alone.
        if (m_quiet || (fraction <= 0 && elapsed < kFirstShowSeconds)) {
            return;
        }
        const int percent = static_cast<int>(fraction * 100);
        if (m_terminal) {
            DrawBar(fraction, percent, elapsed);
        } else if (percent != m_lastPercent && (elapsed - m_lastLine >= 1 || percent == 100)) {
            std::fprintf(stderr, "progress %d%%\n", percent);
            m_lastPercent = percent;
            m_lastLine = elapsed;
        }
    }

    // Ends the bar's line so that what follows starts on a fresh one.
    void Close()
    {
        if (m_drawn) {
            std::fputc('\n', stderr);
            m_drawn = false;
        }
    }

private:
    void DrawBar(double fraction, int percent, double elapsed)
    {
        winsize size{};
        const int columns = ioctl(STDERR_FILENO, TIOCGWINSZ, &size) == 0 && size.ws_col > 0 ? size.ws_col : 80;
        char rate[32] = "";
        char left[32] = "--:-- left";
        if (elapsed > 0.2 && fraction > 0) {
            std::snprintf(rate, sizeof rate, "%.1f MB/s", m_sourceBytes * fraction / elapsed / 1e6);
            if (fraction < 1) {
                std::snprintf(left, sizeof left, "%s left", Clock(elapsed * (1 - fraction) / fraction).c_str());
            } else {
                std::snprintf(left, sizeof left, "%s total", Clock(elapsed).c_str());
            }
        }
        char tail[96];
        std::snprintf(tail, sizeof tail, " %3d%%  %s  %s", percent, rate, left);
        const int width = std::max(10, std::min(50, columns - static_cast<int>(std::string(tail).size()) - 3));
        const int filled = static_cast<int>(fraction * width);
        std::string bar = "\r[" + std::string(filled, '#') + std::string(width - filled, '.') + "]" + tail;
        std::fputs(bar.c_str(), stderr);
        std::fputs("\033[K", stderr);
        std::fflush(stderr);
        m_drawn = true;
    }

    bool m_quiet;
    bool m_terminal;
    double m_sourceBytes;
    bool m_drawn = false;
    int m_lastPercent = -1;
    double m_lastLine = -1;
};

struct Options {
    std::string source;
    std::string destination;
    bool force = false;
    bool quiet = false;
    bool json = false;
    bool sync = false;
    bool progress = false;  // with --json too
};

// fsync of the file, then of its directory: the name and the bytes both reach the device.
bool SyncFile(const std::string& path)
{
    const int file = open(path.c_str(), O_RDONLY | O_CLOEXEC);
    if (file < 0 || fsync(file) != 0) {
        if (file >= 0) {
            close(file);
        }
        return false;
    }
    close(file);
    const size_t slash = path.rfind('/');
    const std::string directory = slash == std::string::npos ? "." : slash == 0 ? "/" : path.substr(0, slash);
    const int folder = open(directory.c_str(), O_RDONLY | O_DIRECTORY | O_CLOEXEC);
    const bool synced = folder >= 0 && fsync(folder) == 0;
    if (folder >= 0) {
        close(folder);
    }
    return synced;
}

// What stands under a name: nothing, or one file at one moment of its life.
struct DirectoryEntry {
    bool exists = false;
    dev_t device = 0;
    ino_t inode = 0;
    timespec changed{};
};

DirectoryEntry DestinationEntry(const std::string& path)
{
    struct stat info{};
    if (lstat(path.c_str(), &info) != 0) {
        return {};
    }
    return {true, info.st_dev, info.st_ino, info.st_ctim};
}

bool SameEntry(const DirectoryEntry& a, const DirectoryEntry& b)
{
    return a.exists == b.exists && (!a.exists || (a.device == b.device && a.inode == b.inode &&
                                                  a.changed.tv_sec == b.changed.tv_sec &&
                                                  a.changed.tv_nsec == b.changed.tv_nsec));
}

// A folder as the destination stands for the source's name in it.
std::string IntoFolder(const std::string& source, const std::string& destination)
{
    struct stat status {};
    const bool folder = destination.ends_with('/') || (stat(destination.c_str(), &status) == 0 && S_ISDIR(status.st_mode));
    const size_t slash = source.rfind('/');
    const std::string name = slash == std::string::npos ? source : source.substr(slash + 1);
    if (!folder || name.empty() || name == "." || name == "..") {
        return destination;
    }
    return destination + (destination.ends_with('/') ? "" : "/") + name;
}

// Not a code the library gives: the job was closed under before it ended.
constexpr int kClosedUnderJob = -1;

void Report(const Options& options, const Verdict& verdict, bool ran, double seconds)
{
    JsonObject report = JsonObject::Report();
    report.Add("source", options.source).Add("destination", options.destination);
    // The reason's code, as every host reports it; what the library itself said comes beside.
    if (verdict.Result() >= 0) {
        report.Add("result", verdict.Result());
    } else {
        report.AddNull("result");  // refused by the tool, before or after the library's job
    }
    report.Add("reason", verdict.Key()).Add("message", verdict.reason == Reason::None ? "done" : verdict.text);
    if (ran && verdict.code >= 0) {
        report.Add("libraryResult", verdict.code);
    } else {
        report.AddNull("libraryResult");
    }
    report.Add("seconds", seconds);
    std::printf("%s\n", report.Text().c_str());
}

}  // namespace

int ProcessCommand(const Arguments& arguments)
{
    CommandLine line("process", kUsage,
                     {{"force", 'f', false}, {"no-overwrite", 'n', false}, {"json", 0, false}, {"sync", 0, false},
                      {"progress", 0, false}});
    if (const int status = line.Parse(arguments); status >= 0) {
        return status;
    }
    if (line.Operands().size() != 2) {
        return line.Misuse("SRC and DST are needed");
    }
    for (const std::string& path : line.Operands()) {
        if (path == "-") {
            return line.Misuse("'-' is not a file: SRC and DST must be files, not standard input or output");
        }
    }
    const std::string& source = line.Operands()[0];
    Options options{source, IntoFolder(source, line.Operands()[1]), line.Has("force") && !line.Has("no-overwrite"),
                    line.Quiet(), line.Has("json"), line.Has("sync"), line.Has("progress")};
    RemoveStalePartials(options.destination);
    if (const Verdict refusal = CheckDestination(options.source, options.destination, options.force);
        refusal.reason != Reason::None) {
        if (options.json) {
            Report(options, refusal, false, 0);
        } else {
            std::fprintf(stderr, "tqovix: %s: %s\n", options.destination.c_str(), refusal.text.c_str());
        }
        return 1;
    }
    struct stat info{};
    const double sourceBytes = stat(options.source.c_str(), &info) == 0 ? static_cast<double>(info.st_size) : 0;

    struct sigaction action{};
    action.sa_handler = OnSignal;
    sigemptyset(&action.sa_mask);
    sigaction(SIGINT, &action, nullptr);
    sigaction(SIGTERM, &action, nullptr);

    // The library's publishing replaces what stands at its destination by then; when that is
    // not wanted, the job writes a hidden name that is given DST's name only if still free.
    const std::string partial = options.force ? std::string() : ReservePartial(options.destination);
    const std::string& target = partial.empty() ? options.destination : partial;
    const DirectoryEntry before = DestinationEntry(target);
    const auto start = std::chrono::steady_clock::now();
    ProgressView view(options.quiet || (options.json && !options.progress), sourceBytes);
    int code = TqInitializeOVIX();
    if (code == 0) {
        code = TqExecuteOVIX(options.source.c_str(), target.c_str());
    }
    double abortedAt = -1;
    double drawnAt = -kRedrawSeconds;
    while (code == 0) {
        const int state = TqIsFinishedOVIX();
        if (state != 0) {
            code = state == 1 ? 0 : state;
            break;
        }
        const double elapsed = SecondsSince(start);
        if (g_signal != 0 && abortedAt < 0) {
            TqAbortOVIX();  // the job ends at the library's next call into us
            abortedAt = elapsed;
        }
        if (abortedAt >= 0 && elapsed - abortedAt > kAbortGraceSeconds) {
            code = kClosedUnderJob;  // what DST holds after the close says how the job ended
            break;
        }
        if (elapsed - drawnAt >= kRedrawSeconds) {
            int first = 0;
            int second = 0;
            TqGetProgressOVIX(&first, &second);
            // Frame counts travel as unsigned 32-bit values in ints.
            const double total = static_cast<uint32_t>(second);
            const double fraction = total > 0 ? std::min(1.0, static_cast<uint32_t>(first) / total) : 0;
            view.Show(fraction, elapsed);
            drawnAt = elapsed;
        }
        std::this_thread::sleep_for(kPollInterval);
    }
    const double seconds = SecondsSince(start);
    if (code == 0) {
        view.Show(1.0, seconds);  // the library resets its progress once the job has finished
    }
    view.Close();
    TqCloseOVIX();
    if (code == kClosedUnderJob) {
        // Only a complete movie ever takes DST's name: a changed DST is the job's result.
        code = SameEntry(before, DestinationEntry(target)) ? 200 : 0;
    }
    Verdict verdict = Explain(code, options.source, options.destination);
    if (!partial.empty()) {
        const int error = code == 0 ? PublishWithoutReplacing(partial, options.destination) : 0;
        if (error == EEXIST) {
            verdict = MakeVerdict(-1, Reason::DestinationExists, "it appeared while the job ran");
        } else if (error != 0) {
            verdict = MakeVerdict(190, Reason::WriteFailed, std::strerror(error));
        }
        code = error != 0 ? verdict.code : code;
        if (code != 0) {
            unlink(partial.c_str());
        }
    }
    if (code == 0 && options.sync && !SyncFile(options.destination)) {
        code = 190;
        verdict = MakeVerdict(code, Reason::WriteFailed, std::string("cannot make it durable: ") + std::strerror(errno));
    }
    if (options.json) {
        Report(options, verdict, true, seconds);
    } else if (code == 0) {
        if (!options.quiet) {
            std::printf("%s: done\n", options.destination.c_str());
        }
    } else {
        const std::string& named = AboutDestination(verdict.reason) ? options.destination : options.source;
        std::fprintf(stderr, "tqovix: %s: %s\n", named.c_str(), verdict.text.c_str());
    }
    std::fflush(stdout);
    if (code == 200 && g_signal != 0) {
        return 130;
    }
    return code == 0 ? 0 : 1;
}

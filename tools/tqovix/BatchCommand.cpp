// tqovix batch: many movies, one job per child process (the library runs one job per
// process), a few at a time, then a summary table.
#include <algorithm>
#include <cerrno>
#include <csignal>
#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <fcntl.h>
#include <set>
#include <string>
#include <sys/stat.h>
#include <sys/wait.h>
#include <unistd.h>
#include <utility>
#include <vector>

#include "Commands.h"

namespace {

constexpr const char* kUsage =
    "usage: tqovix batch -o OUTDIR [-j N] [--force] FILE...\n"
    "  processes every FILE into OUTDIR under its own name, N jobs at a time (default: one\n"
    "  per core), each in a child process, and prints a summary table\n"
    "  --force   overwrite existing files in OUTDIR\n"
    "  exit status: 0 all done, 1 any file failed, 2 usage error, 130 interrupted\n";

volatile std::sig_atomic_t g_signal = 0;

void OnSignal(int number) { g_signal = number; }

struct Job {
    std::string source;
    std::string destination;
    pid_t pid = -1;
    int output = -1;  // read end of the child's standard output
    bool finished = false;
    bool ok = false;
    std::string message = "not started";
    double seconds = 0;
};

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

bool Start(Job& job, bool force)
{
    int ends[2];
    if (pipe2(ends, O_CLOEXEC) != 0) {
        return false;
    }
    job.pid = fork();
    if (job.pid == 0) {
        dup2(ends[1], STDOUT_FILENO);
        const char* argv[] = {"tqovix",  "process", job.source.c_str(), job.destination.c_str(), "--quiet",
                              "--json", force ? "--force" : nullptr, nullptr};
        execv("/proc/self/exe", const_cast<char* const*>(argv));
        _exit(127);
    }
    close(ends[1]);
    if (job.pid < 0) {
        close(ends[0]);
        return false;
    }
    job.output = ends[0];
    return true;
}

void Collect(Job& job, int status)
{
    std::string json;
    char buffer[4096];
    ssize_t count = 0;
    while ((count = read(job.output, buffer, sizeof buffer)) > 0 || (count < 0 && errno == EINTR)) {
        json.append(buffer, static_cast<size_t>(std::max<ssize_t>(count, 0)));
    }
    close(job.output);
    job.finished = true;
    job.seconds = std::atof(JsonValue(json, "seconds").c_str());
    const std::string result = JsonValue(json, "result");
    job.ok = WIFEXITED(status) && WEXITSTATUS(status) == 0 && result == "0";
    if (!JsonValue(json, "message").empty()) {
        job.message = JsonValue(json, "message");
        if (!job.ok && !result.empty() && result != "null") {
            job.message += " (" + result + ")";
        }
    } else if (WIFSIGNALED(status)) {
        job.message = "killed by signal " + std::to_string(WTERMSIG(status));
    } else {
        job.message = "exit status " + std::to_string(WIFEXITED(status) ? WEXITSTATUS(status) : -1);
    }
}

void PrintSummary(const std::vector<Job>& jobs)
{
    size_t nameWidth = 4;
    size_t resultWidth = 6;
    for (const Job& job : jobs) {
        nameWidth = std::max(nameWidth, job.source.size());
        resultWidth = std::max(resultWidth, job.message.size() + (job.ok ? 0 : 8));
    }
    std::printf("\n%-*s  %-*s  %8s\n", static_cast<int>(nameWidth), "file", static_cast<int>(resultWidth),
                "result", "seconds");
    size_t failed = 0;
    for (const Job& job : jobs) {
        const std::string result = job.ok ? job.message : "failed: " + job.message;
        std::printf("%-*s  %-*s  %8.2f\n", static_cast<int>(nameWidth), job.source.c_str(),
                    static_cast<int>(resultWidth), result.c_str(), job.seconds);
        failed += job.ok ? 0 : 1;
    }
    std::printf("%zu files: %zu done, %zu failed\n", jobs.size(), jobs.size() - failed, failed);
}

}  // namespace

int BatchCommand(const Arguments& arguments)
{
    std::string outputDirectory;
    long parallel = std::max(1L, sysconf(_SC_NPROCESSORS_ONLN));
    bool force = false;
    std::vector<Job> jobs;
    for (size_t i = 0; i < arguments.size(); ++i) {
        const std::string& argument = arguments[i];
        if (argument == "--help") {
            std::fputs(kUsage, stdout);
            return 0;
        }
        if ((argument == "-o" || argument == "-j") && i + 1 < arguments.size()) {
            const std::string& value = arguments[++i];
            if (argument == "-o") {
                outputDirectory = value;
                continue;
            }
            char* end = nullptr;
            parallel = std::strtol(value.c_str(), &end, 10);
            if (*end != '\0' || parallel < 1 || parallel > 256) {
                std::fprintf(stderr, "tqovix batch: -j takes a number from 1 to 256\n");
                return 2;
            }
        } else if (argument == "--force") {
            force = true;
        } else if (argument.size() > 1 && argument[0] == '-') {
            std::fprintf(stderr, "tqovix batch: unknown or incomplete option '%s'\n%s", argument.c_str(), kUsage);
            return 2;
        } else {
            Job job;
            job.source = argument;
            jobs.push_back(std::move(job));
        }
    }
    struct stat info{};
    if (outputDirectory.empty() || jobs.empty()) {
        std::fputs(kUsage, stderr);
        return 2;
    }
    if (stat(outputDirectory.c_str(), &info) != 0 || !S_ISDIR(info.st_mode)) {
        std::fprintf(stderr, "tqovix batch: %s: not a directory\n", outputDirectory.c_str());
        return 2;
    }
    std::set<std::string> names;
    for (Job& job : jobs) {
        const size_t slash = job.source.find_last_of('/');
        const std::string name = slash == std::string::npos ? job.source : job.source.substr(slash + 1);
        job.destination = outputDirectory + "/" + name;
        if (name.empty() || !names.insert(name).second) {
            job.finished = true;  // two jobs must never write one destination
            job.message = name.empty() ? "no file name" : "another file in this batch has the same name";
        }
    }

    struct sigaction action{};
    action.sa_handler = OnSignal;
    sigemptyset(&action.sa_mask);
    sigaction(SIGINT, &action, nullptr);
    sigaction(SIGTERM, &action, nullptr);

    size_t next = 0;
    size_t running = 0;
    size_t completed = 0;
    bool forwarded = false;
    for (;;) {
        while (g_signal == 0 && running < static_cast<size_t>(parallel) && next < jobs.size()) {
            Job& job = jobs[next++];
            if (job.finished) {
                continue;
            }
            if (Start(job, force)) {
                ++running;
            } else {
                job.finished = true;
                job.message = std::string("could not start a job: ") + std::strerror(errno);
            }
        }
        if (running == 0) {
            break;
        }
        if (g_signal != 0 && !forwarded) {
            for (const Job& job : jobs) {
                if (job.pid > 0 && !job.finished) {
                    kill(job.pid, g_signal);  // each child aborts its job and removes its output
                }
            }
            forwarded = true;
        }
        int status = 0;
        const pid_t pid = waitpid(-1, &status, 0);
        if (pid < 0) {
            if (errno == EINTR) {
                continue;  // a signal: forwarded above
            }
            break;
        }
        for (Job& job : jobs) {
            if (job.pid == pid && !job.finished) {
                Collect(job, status);
                --running;
                std::fprintf(stderr, "[%zu/%zu] %s: %s\n", ++completed, jobs.size(), job.source.c_str(),
                             job.message.c_str());
            }
        }
    }
    PrintSummary(jobs);
    if (g_signal != 0) {
        return 128 + g_signal;
    }
    return std::all_of(jobs.begin(), jobs.end(), [](const Job& job) { return job.ok; }) ? 0 : 1;
}

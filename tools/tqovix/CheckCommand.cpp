// tqovix check: whether the library would process each movie, and if not, why.
#include <cstdio>
#include <string>

#include "CommandLine.h"
#include "Json.h"
#include "MovieSearch.h"
#include "Reasons.h"
#include "api/TqOVIXUtility.h"

namespace {

constexpr const char* kUsage =
    "usage: tqovix check [-r] [--json] PATH...\n"
    "  asks the library, for each movie, whether it can remove the AF noise of its sound,\n"
    "  and prints \"FILE: processable\" or \"FILE: not processable: REASON\"; an AAC movie whose\n"
    "  sound must be re-encoded whole (not only around the AF intervals) says why. A folder PATH\n"
    "  is searched for movies (by their content, not their names; other files are passed over)\n"
    "  -r, --recursive   search folders and their subfolders\n"
    "  --json            one JSON object with a row per file instead of text\n"
    "  -q                print only the files that are not processable\n"
    "  exit status: 0 all processable, 1 any file not processable or a folder without movies,\n"
    "  2 usage error\n";

}  // namespace

int CheckCommand(const Arguments& arguments)
{
    CommandLine line("check", kUsage, {{"json", 0, false}, {"recursive", 'r', false}});
    if (const int status = line.Parse(arguments); status >= 0) {
        return status;
    }
    if (line.Operands().empty()) {
        return line.Misuse("no PATH given");
    }
    const MovieSearch search = FindMovies(line.Operands(), line.Has("recursive"), "check");
    const int started = TqInitializeOVIX();
    if (started != 0) {
        std::fprintf(stderr, "tqovix: the library did not start: %s\n", Explain(started, "").text.c_str());
        return 1;
    }
    bool allProcessable = !search.anyFolderEmpty;
    std::vector<std::string> rows;
    for (const std::string& file : search.files) {
        const int code = TqGetPropertyOVIX(file.c_str());
        const Verdict verdict = Explain(code, file);
        allProcessable = allProcessable && code == 0;
        const std::string whole = code == 0 ? AacWholeReason(file) : std::string();
        if (line.Has("json")) {
            JsonObject row;
            row.Add("file", file).Add("processable", code == 0).Add("code", code).Add("reason", verdict.Key());
            if (code == 0) {
                row.AddNull("message");
            } else {
                row.Add("message", verdict.text);
            }
            if (whole.empty()) {
                row.AddNull("aacReencodedWhole");
            } else {
                row.Add("aacReencodedWhole", whole);
            }
            rows.push_back(row.Text());
        } else if (code == 0) {
            if (!line.Quiet() && whole.empty()) {
                std::printf("%s: processable\n", file.c_str());
            } else if (!line.Quiet()) {
                std::printf("%s: processable; its AAC sound is re-encoded whole: %s\n", file.c_str(), whole.c_str());
            }
        } else {
            std::printf("%s: not processable: %s\n", file.c_str(), verdict.text.c_str());
        }
        std::fflush(stdout);
    }
    TqCloseOVIX();
    if (line.Has("json")) {
        std::printf("%s\n", JsonObject::Report().AddJson("files", JsonArray(rows)).Text().c_str());
    }
    return allProcessable ? 0 : 1;
}

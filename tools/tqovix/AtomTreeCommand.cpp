// tqovix inspect: a summary of each file, then the atom tree of any QuickTime or ISO file, and
// for a movie the tracks, the trim tags and the maker blocks as the library's visitors read
// them; whether the AF information has been processed already, or why the library would
// refuse the file.
#include <cstdio>
#include <sys/stat.h>

#include "CommandLine.h"
#include "Inspection.h"
#include "Json.h"
#include "MovieSearch.h"

namespace {

constexpr const char* kUsage =
    "usage: tqovix inspect [-r] [-q] [--json] PATH...\n"
    "  for each file: a summary (what it is, its duration and tracks, whether the AF information\n"
    "  is processed, or why the library would refuse it), then the atom tree (offset, size, type)\n"
    "  of any QuickTime or ISO file, and for a movie the tracks, the trim tags and the sizes of\n"
    "  the AF and audio level information. A file that is no movie is named by its first bytes\n"
    "  (a JPEG, PNG or TIFF/raw still, an XML sidecar, plain text). A folder PATH is searched for\n"
    "  movies (by their content, not their names)\n"
    "  -r, --recursive   search folders and their subfolders\n"
    "  -q, --quiet       the summary alone\n"
    "  --json            one JSON object instead of text (for several files or a folder, with a\n"
    "                    row per file)\n"
    "  exit status: 0 inspected (even a file the library refuses), 1 a file unreadable or a\n"
    "  folder without movies, 2 usage\n";

}  // namespace

int InspectCommand(const Arguments& arguments)
{
    CommandLine line("inspect", kUsage, {{"json", 0, false}, {"recursive", 'r', false}});
    if (const int status = line.Parse(arguments); status >= 0) {
        return status;
    }
    if (line.Operands().empty()) {
        return line.Misuse("no PATH given");
    }
    const bool json = line.Has("json");
    const MovieSearch search = FindMovies(line.Operands(), line.Has("recursive"), "inspect");
    // One file named keeps the report it always had; more are rows of one report.
    const bool single = line.Operands().size() == 1 && search.files.size() == 1 && search.files[0] == line.Operands()[0];
    bool allRead = !search.anyFolderEmpty;
    std::vector<std::string> rows;
    for (size_t i = 0; i < search.files.size(); ++i) {
        const std::string& path = search.files[i];
        struct stat status {};
        const bool file = stat(path.c_str(), &status) == 0 && S_ISREG(status.st_mode);
        const Inspection inspection = file ? Inspect(path) : Inspection{};
        if (!file || !inspection.structure.readable) {
            allRead = false;
            const Verdict verdict = Explain(190, path);
            JsonObject row = single ? JsonObject::Report() : JsonObject();
            rows.push_back(row.Add("file", path).Add("reason", verdict.Key()).Add("message", verdict.text).Text());
            if (!json) {
                std::fprintf(stderr, "tqovix: %s: %s\n", path.c_str(), verdict.text.c_str());
            }
            continue;
        }
        if (json) {
            rows.push_back(InspectionJson(inspection, single));
            continue;
        }
        if (i > 0) {
            std::printf("\n");
        }
        PrintInspectionText(inspection, line.Quiet());
        std::fflush(stdout);
    }
    if (json && single) {
        std::printf("%s\n", rows[0].c_str());
    } else if (json) {
        std::printf("%s\n", JsonObject::Report().AddJson("files", JsonArray(rows)).Text().c_str());
    }
    return allRead ? 0 : 1;
}

// tqovix inspect: the atom tree of any QuickTime or ISO file, and for a movie the tracks, the
// trim tags and the maker blocks as the library's visitors read them; whether the AF
// information has been processed already, or why the library would refuse the file.
#include <cstdio>
#include <sys/stat.h>

#include "CommandLine.h"
#include "Inspection.h"
#include "Json.h"

namespace {

constexpr const char* kUsage =
    "usage: tqovix inspect [--json] FILE\n"
    "  prints the atom tree (offset, size, type) of any QuickTime or ISO file, and for a\n"
    "  movie the tracks, the trim tags, the sizes of the AF and audio level information and\n"
    "  whether the AF information is processed, or why the library would refuse the file\n"
    "  --json    one JSON object instead of text\n"
    "  exit status: 0 inspected (even a file the library refuses), 1 unreadable, 2 usage\n";

}  // namespace

int InspectCommand(const Arguments& arguments)
{
    CommandLine line("inspect", kUsage, {{"json", 0, false}});
    if (const int status = line.Parse(arguments); status >= 0) {
        return status;
    }
    if (line.Operands().size() != 1) {
        return line.Misuse("one FILE is needed");
    }
    const std::string path = line.Operands()[0];
    struct stat status {};
    const bool file = stat(path.c_str(), &status) == 0 && S_ISREG(status.st_mode);
    const Inspection inspection = file ? Inspect(path) : Inspection{};
    if (!file || !inspection.structure.readable) {
        const Verdict verdict = Explain(190, path);
        if (line.Has("json")) {
            std::printf("%s\n", JsonObject::Report()
                                    .Add("file", path)
                                    .Add("reason", verdict.Key())
                                    .Add("message", verdict.text)
                                    .Text()
                                    .c_str());
        } else {
            std::fprintf(stderr, "tqovix: %s: %s\n", path.c_str(), verdict.text.c_str());
        }
        return 1;
    }
    if (line.Has("json")) {
        PrintInspectionJson(inspection);
    } else {
        PrintInspectionText(inspection);
    }
    return 0;
}

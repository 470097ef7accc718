// tqovix inspect: the atom tree as the parser sees it, the tracks, the trim tags and the
// maker blocks as the library's visitors read them, and whether the AF information has
// been processed already.
#include <cstdio>

#include "Commands.h"
#include "Inspection.h"
#include "atom/CTqovixAtomControl.h"
#include "file/CTqovixFile.h"

namespace {

constexpr const char* kUsage =
    "usage: tqovix inspect FILE [--json]\n"
    "  prints the atom tree (offset, size, type), the tracks, the trim tags, the sizes of\n"
    "  the AF and audio level information and whether the AF information is processed\n";

}  // namespace

int InspectCommand(Arguments arguments)
{
    const bool json = std::erase(arguments, std::string("--json")) > 0;
    if (arguments.size() != 1 || arguments[0].starts_with("-")) {
        const bool help = arguments.size() == 1 && arguments[0] == "--help";
        std::fputs(kUsage, help ? stdout : stderr);
        return help ? 0 : 2;
    }
    const std::string path = arguments[0];
    CTqovixFile file;
    CTqovixAtomControl tree;
    eTqovixErrorCode result = file.Open(path.c_str(), 1);
    if (!TqovixFailed(result)) {
        result = tree.Initialize(file);
    }
    if (TqovixFailed(result)) {
        std::fprintf(stderr, "tqovix: %s: %s (code %d)\n", path.c_str(), DescribeInternalCode(result).c_str(), result);
        return 1;
    }
    const Inspection inspection = Inspect(path, tree);
    if (json) {
        PrintInspectionJson(inspection);
    } else {
        PrintInspectionText(inspection);
    }
    return 0;
}

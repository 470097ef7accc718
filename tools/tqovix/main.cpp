// tqovix: the command-line host of the library.
#include <cstdio>
#include <cstring>

#include "Commands.h"

namespace {

constexpr const char* kUsage =
    "usage: tqovix COMMAND [ARGS]\n"
    "\n"
    "commands:\n"
    "  check FILE...              tell whether each movie can be processed, or why not\n"
    "  process SRC DST [opts]     remove the AF noise of SRC's sound, writing DST\n"
    "  batch -o OUTDIR FILE...    process many movies, several at a time\n"
    "  inspect FILE [--json]      atom tree, tracks, trim tags and maker data of a movie\n"
    "  make-sample DST [opts]     write a camera-style movie to try the others on\n"
    "  compare SRC DST [opts]     measure and draw what processing did to the sound\n"
    "\n"
    "  tqovix COMMAND --help      the options of a command\n"
    "\n"
    "  --version                  print the version\n";

}  // namespace

int main(int argc, char** argv)
{
    if (argc < 2 || std::strcmp(argv[1], "--help") == 0 || std::strcmp(argv[1], "-h") == 0) {
        std::fputs(kUsage, argc < 2 ? stderr : stdout);
        return argc < 2 ? 2 : 0;
    }
    if (std::strcmp(argv[1], "--version") == 0) {
        std::puts("tqovix 0.1.0");
        return 0;
    }
    const Arguments arguments(argv + 2, argv + argc);
    if (std::strcmp(argv[1], "inspect") == 0) {
        return InspectCommand(arguments);
    }
    if (std::strcmp(argv[1], "make-sample") == 0) {
        return MakeSampleCommand(arguments);
    }
    if (std::strcmp(argv[1], "check") == 0) {
        return CheckCommand(arguments);
    }
    if (std::strcmp(argv[1], "process") == 0) {
        return ProcessCommand(arguments);
    }
    if (std::strcmp(argv[1], "batch") == 0) {
        return BatchCommand(arguments);
    }
    if (std::strcmp(argv[1], "compare") == 0) {
        return CompareCommand(arguments);
    }
    std::fprintf(stderr, "tqovix: unknown command '%s'\n%s", argv[1], kUsage);
    return 2;
}

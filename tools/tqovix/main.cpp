// tqovix: the command-line host of the library.
#include <cstdio>
#include <cstring>
#include <string>

#include "Commands.h"
#include "LibavHandles.h"

namespace {

constexpr const char* kUsage =
    "usage: tqovix COMMAND [OPTIONS] [ARGS]\n"
    "\n"
    "commands:\n"
    "  check FILE...              tell whether each movie can be processed, or why not\n"
    "  process SRC DST            remove the AF noise of SRC's sound, writing DST\n"
    "  batch -o OUTDIR PATH...    process many movies or folders of them, several at a time\n"
    "  inspect FILE               atom tree, tracks, trim tags and maker data of a file\n"
    "  make-sample DST            write a camera-style movie to try the others on\n"
    "  compare SRC DST            measure and draw what processing did to the sound\n"
    "\n"
    "  tqovix COMMAND -h          the options of a command\n"
    "  -h, --help                 this text\n"
    "  --version                  the versions of tqovix, the library and libavcodec\n"
    "\n"
    "Every command takes -q/--quiet and -v, and \"--\" to end its options; results go to\n"
    "stdout, messages to stderr. Exit status: 0 done, 1 failed or refused, 2 usage error,\n"
    "130 interrupted.\n";

void PrintVersions()
{
    std::printf("tqovix %s\nlibTqOVIXUtility %s\n", TQOVIX_VERSION, TQOVIX_VERSION);
    const atcompat::LibavApi* libav = atcompat::LoadLibav();
    if (libav == nullptr) {
        std::printf("libavcodec not found (AAC movies cannot be processed)\n");
        return;
    }
    const unsigned version = libav->avcodec_version();
    std::printf("libavcodec %u.%u.%u\n", version >> 16, version >> 8 & 0xFF, version & 0xFF);
}

struct Command {
    const char* name;
    int (*run)(const Arguments&);
};

}  // namespace

int main(int argc, char** argv)
{
    if (argc < 2) {
        std::fputs(kUsage, stderr);
        return 2;
    }
    const std::string first = argv[1];
    if (first == "--help" || first == "-h") {
        std::fputs(kUsage, stdout);
        return 0;
    }
    if (first == "--version") {
        PrintVersions();
        return 0;
    }
    static constexpr Command kCommands[] = {
        {"check", CheckCommand},     {"process", ProcessCommand},         {"batch", BatchCommand},
        {"inspect", InspectCommand}, {"make-sample", MakeSampleCommand}, {"compare", CompareCommand},
    };
    for (const Command& command : kCommands) {
        if (first == command.name) {
            return command.run(Arguments(argv + 2, argv + argc));
        }
    }
    std::fprintf(stderr, "tqovix: unknown command '%s'\n%s", argv[1], kUsage);
    return 2;
}

// tqovix: the command-line host of the library.
#include <cstdio>
#include <cstring>

#include "Commands.h"

namespace {

constexpr const char* kUsage =
    "usage: tqovix COMMAND [ARGS]\n"
    "\n"
    "commands:\n"
    "  inspect FILE            print the atom tree of a movie with offsets and sizes\n"
    "  make-sample DST [opts]  write a camera-style movie (see tqovix make-sample --help)\n"
    "\n"
    "  --version               print the version\n";

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
    std::fprintf(stderr, "tqovix: unknown command '%s'\n%s", argv[1], kUsage);
    return 2;
}

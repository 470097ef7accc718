// tqovix: the command-line host of the library.
#include <cstdio>
#include <cstring>
#include <string>

#include "CommandLine.h"
#include "Commands.h"
#include "LibavHandles.h"

namespace {

constexpr const char* kUsage =
    "usage: tqovix COMMAND [OPTIONS] [ARGS]\n"
    "\n"
    "commands:\n"
    "  check PATH...              tell whether each movie can be processed, or why not\n"
    "  process SRC DST            remove the AF noise of SRC's sound, writing DST (a file or a folder)\n"
    "  batch -o OUTDIR PATH...    process many movies or folders of them, several at a time\n"
    "  inspect PATH...            summary, atom tree, tracks, trim tags and maker data of files\n"
    "  make-sample DST            write a camera-style movie to try the others on\n"
    "  compare SRC DST            measure and draw what processing did to the sound\n"
    "\n"
    "  tqovix COMMAND -h          the options of a command (or: tqovix help COMMAND)\n"
    "  -h, --help                 this text\n"
    "  --version                  the versions of tqovix, the library and libavcodec\n"
    "\n"
    "Every command takes -q/--quiet and -v, and \"--\" to end its options; options may stand\n"
    "before the command too (tqovix -q check FILE). Results go to stdout, messages to stderr.\n"
    "Exit status: 0 done, 1 failed or refused, 2 usage error, 130 interrupted.\n";

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

constexpr Command kCommands[] = {
    {"check", CheckCommand},     {"process", ProcessCommand},         {"batch", BatchCommand},
    {"inspect", InspectCommand}, {"make-sample", MakeSampleCommand}, {"compare", CompareCommand},
};

const Command* FindCommand(const std::string& name)
{
    for (const Command& command : kCommands) {
        if (name == command.name) {
            return &command;
        }
    }
    return nullptr;
}

int UnknownCommand(const std::string& name)
{
    std::vector<std::string> names;
    for (const Command& command : kCommands) {
        names.push_back(command.name);
    }
    names.push_back("help");
    const std::string meant = ClosestName(name, names);
    std::fprintf(stderr, "tqovix: unknown command '%s'%s (tqovix -h lists the commands)\n", name.c_str(),
                 meant.empty() ? "" : ("; did you mean '" + meant + "'?").c_str());
    return 2;
}

}  // namespace

int main(int argc, char** argv)
{
    if (argc < 2) {
        std::fputs(kUsage, stderr);
        return 2;
    }
    // Options before the command are the command's: "tqovix -q check" is "tqovix check -q".
    Arguments leading;
    int at = 1;
    for (; at < argc && argv[at][0] == '-'; ++at) {
        const std::string option = argv[at];
        if (option == "--help" || option == "-h") {
            std::fputs(kUsage, stdout);
            return 0;
        }
        if (option == "--version") {
            PrintVersions();
            return 0;
        }
        leading.push_back(option);
    }
    if (at == argc) {
        std::fputs("tqovix: no command given (tqovix -h lists the commands)\n", stderr);
        return 2;
    }
    std::string name = argv[at];
    Arguments arguments(argv + at + 1, argv + argc);
    if (name == "help") {
        if (arguments.empty()) {
            std::fputs(kUsage, stdout);
            return 0;
        }
        name = arguments[0];
        arguments = {"--help"};
    }
    const Command* command = FindCommand(name);
    if (command == nullptr) {
        return UnknownCommand(name);
    }
    leading.insert(leading.end(), arguments.begin(), arguments.end());
    return command->run(leading);
}

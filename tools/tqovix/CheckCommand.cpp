// tqovix check: whether the library would process each movie, and if not, why.
#include <cstdint>
#include <cstdio>
#include <cstring>
#include <string>

#include "Commands.h"
#include "api/TqOVIXUtility.h"
#include "movie/CTqovixMovControl.h"

namespace {

constexpr const char* kUsage =
    "usage: tqovix check FILE...\n"
    "  asks the library, for each movie, whether it can remove the AF noise of its sound,\n"
    "  and prints \"FILE: processable\" or \"FILE: not processable: REASON\"\n"
    "  exit status: 0 all processable, 1 any file not processable, 2 usage error\n";

constexpr int kMaxTopLevelAtoms = 64;

uint64_t ReadBig(const unsigned char* bytes, int count)
{
    uint64_t value = 0;
    for (int i = 0; i < count; ++i) {
        value = value << 8 | bytes[i];
    }
    return value;
}

// The major brand of the file's "ftyp" atom, looked for among its first top-level atoms;
// empty when there is none (or the file cannot be read).
std::string MajorBrand(const std::string& path)
{
    FILE* file = std::fopen(path.c_str(), "rb");
    if (file == nullptr) {
        return {};
    }
    std::string brand;
    uint64_t offset = 0;
    for (int i = 0; i < kMaxTopLevelAtoms; ++i) {
        unsigned char header[16];
        if (fseeko(file, static_cast<off_t>(offset), SEEK_SET) != 0 || std::fread(header, 1, 8, file) != 8) {
            break;
        }
        uint64_t size = ReadBig(header, 4);
        uint64_t headerSize = 8;
        if (size == 1) {
            if (std::fread(header + 8, 1, 8, file) != 8) {
                break;
            }
            size = ReadBig(header + 8, 8);
            headerSize = 16;
        }
        if (std::memcmp(header + 4, "ftyp", 4) == 0) {
            char major[4];
            if (size >= headerSize + 4 && std::fread(major, 1, 4, file) == 4) {
                brand.assign(major, 4);
            }
            break;
        }
        if (size < headerSize || offset + size < offset) {
            break;  // size 0 (to the end of the file) or damaged: no further atom to read
        }
        offset += size;
    }
    std::fclose(file);
    return brand;
}

std::string Printable(std::string text)
{
    for (char& c : text) {
        if (static_cast<unsigned char>(c) < 0x20 || static_cast<unsigned char>(c) > 0x7e) {
            c = '.';
        }
    }
    return text;
}

std::string Reason(int code, const std::string& path)
{
    if (code == 8) {
        // The exported code does not say which of its reasons the library had: the parser,
        // running the same analysis as a job, words it.
        CTqovixMovControl control;
        const bool opened = !TqovixFailed(control.Initialize(path.c_str(), nullptr));
        const std::string refusal = control.GetRefusal();
        control.Close();
        const std::string brand = MajorBrand(path);
        if (!opened && !refusal.empty() && (brand == "qt  " || brand == "mp42")) {
            return refusal;
        }
        if (!brand.empty() && brand != "qt  " && brand != "mp42") {
            return "not a camera movie (brand '" + Printable(brand) + "')";
        }
    }
    return DescribeResult(code);
}

}  // namespace

int CheckCommand(const Arguments& arguments)
{
    Arguments files;
    bool optionsEnded = false;
    for (const std::string& argument : arguments) {
        if (!optionsEnded && argument == "--help") {
            std::fputs(kUsage, stdout);
            return 0;
        }
        if (!optionsEnded && argument == "--") {
            optionsEnded = true;
        } else if (!optionsEnded && argument.size() > 1 && argument[0] == '-') {
            std::fprintf(stderr, "tqovix check: unknown option '%s'\n%s", argument.c_str(), kUsage);
            return 2;
        } else {
            files.push_back(argument);
        }
    }
    if (files.empty()) {
        std::fputs(kUsage, stderr);
        return 2;
    }
    const int started = TqInitializeOVIX();
    if (started != 0) {
        std::fprintf(stderr, "tqovix: the library did not start: %s\n", DescribeResult(started).c_str());
        return 1;
    }
    bool allProcessable = true;
    for (const std::string& file : files) {
        const int code = TqGetPropertyOVIX(file.c_str());
        if (code == 0) {
            std::printf("%s: processable\n", file.c_str());
        } else {
            std::printf("%s: not processable: %s\n", file.c_str(), Reason(code, file).c_str());
            allProcessable = false;
        }
        std::fflush(stdout);
    }
    TqCloseOVIX();
    return allProcessable ? 0 : 1;
}

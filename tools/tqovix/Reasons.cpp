#include "Reasons.h"

#include <sys/stat.h>
#include <sys/statvfs.h>
#include <unistd.h>

#include <algorithm>
#include <cerrno>
#include <cstdio>
#include <cstring>

#include "Structure.h"
#include "engine/CTqovixMainFrame.h"
#include "movie/CTqovixMovControl.h"

namespace {

const ReasonRow& Row(Reason reason)
{
    for (const ReasonRow& row : ReasonTable()) {
        if (row.reason == reason) {
            return row;
        }
    }
    return ReasonTable().back();
}

std::string DirectoryOf(const std::string& path)
{
    const size_t slash = path.find_last_of('/');
    return slash == std::string::npos ? "." : slash == 0 ? "/" : path.substr(0, slash);
}

bool IsProcessed(const std::string& path)
{
    CTqovixMainFrame engine;
    const bool processed = engine.Initialize() == eTqovixSuccess && engine.GetProperty(path.c_str()) == eTqovixVerdict20;
    engine.Close();
    return processed;
}

Reason FromRefusal(eTqovixRefusal kind)
{
    switch (kind) {
    case eTqovixRefusal::NotAMovie: return Reason::NotAMovie;
    case eTqovixRefusal::Fragmented: return Reason::Fragmented;
    case eTqovixRefusal::NoSoundTrack: return Reason::NoSoundTrack;
    case eTqovixRefusal::UnsupportedSound: return Reason::UnsupportedSound;
    case eTqovixRefusal::UnsupportedLayout: return Reason::UnsupportedLayout;
    case eTqovixRefusal::NoAFInformation: return Reason::NoAFInformation;
    case eTqovixRefusal::Malformed: return Reason::MalformedAtom;
    case eTqovixRefusal::None: break;
    }
    return Reason::None;
}

// What is wrong with the file's content, when the library refuses it.
Verdict ExplainContent(int code, const std::string& source)
{
    const Structure structure = ScanStructure(source);
    if (!structure.readable) {
        return MakeVerdict(120, Reason::SourceAccessDenied, structure.systemError);
    }
    if (structure.fileSize == 0) {
        return MakeVerdict(code, Reason::EmptyFile);
    }
    if (!structure.atomic) {
        return MakeVerdict(code, Reason::NotAMovie);
    }
    if (!structure.brand.empty() && structure.brand != "qt  " && structure.brand != "mp42") {
        return MakeVerdict(code, Reason::WrongBrand, structure.brand);
    }
    if (structure.wholeSize > 0) {
        return MakeVerdict(code, Reason::Truncated, SizesText(structure.fileSize, structure.wholeSize));
    }
    if (!structure.fault.empty()) {
        return MakeVerdict(code, Reason::MalformedAtom, structure.fault);
    }
    if (IsProcessed(source)) {
        return MakeVerdict(code, Reason::AlreadyProcessed);
    }
    CTqovixMovControl control;
    control.Initialize(source.c_str(), nullptr);
    const Reason reason = FromRefusal(control.GetRefusalKind());
    const std::string refusal = control.GetRefusal();
    control.Close();
    if (reason == Reason::NotAMovie) {
        // The walk found every byte accounted for: what is left is the brand.
        return MakeVerdict(code, Reason::WrongBrand, structure.brand.empty() ? "none" : structure.brand);
    }
    if (reason == Reason::NoSoundTrack || reason == Reason::Fragmented || reason == Reason::NoAFInformation) {
        return MakeVerdict(code, reason);
    }
    if (reason != Reason::None) {
        return MakeVerdict(code, reason, refusal);
    }
    return code == 8 ? MakeVerdict(code, Reason::NoAFInformation) : MakeVerdict(code, Reason::Internal);
}

}  // namespace

namespace {

struct Unit {
    double scale;
    const char* name;
};

Unit UnitFor(uint64_t bytes)
{
    return bytes >= 1'000'000'000 ? Unit{1e9, "GB"} : bytes >= 1'000'000 ? Unit{1e6, "MB"} : Unit{1e3, "KB"};
}

std::string Formatted(double value)
{
    char text[32];
    std::snprintf(text, sizeof text, "%.1f", value);
    return text;
}

}  // namespace

std::string SizeText(uint64_t bytes)
{
    const Unit unit = UnitFor(bytes);
    return Formatted(static_cast<double>(bytes) / unit.scale) + " " + unit.name;
}

std::string SizesText(uint64_t part, uint64_t whole)
{
    const Unit unit = UnitFor(std::max(part, whole));
    return Formatted(static_cast<double>(part) / unit.scale) + " of " + Formatted(static_cast<double>(whole) / unit.scale) +
           " " + unit.name;
}

const std::vector<ReasonRow>& ReasonTable()
{
    static const std::vector<ReasonRow> table = {
        {Reason::None, "none", 0, "processable"},
        {Reason::Aborted, "aborted", 200, "aborted"},
        {Reason::SourceMissing, "source-missing", 110, "file not found"},
        {Reason::SourceIsDirectory, "source-is-directory", 190, "the source is a directory"},
        {Reason::SourceNotRegularFile, "not-a-regular-file", 110, "not a regular file"},
        {Reason::SourceAccessDenied, "source-access-denied", 120, "cannot read the file"},
        {Reason::SameFile, "same-file", 190, "source and destination are the same file"},
        {Reason::DestinationIsDirectory, "destination-is-directory", 190, "the destination is a directory"},
        {Reason::DestinationDirectoryMissing, "destination-directory-missing", 111,
         "the destination's directory does not exist"},
        {Reason::DestinationAccessDenied, "destination-access-denied", 121, "cannot write the destination"},
        {Reason::DestinationExists, "destination-exists", -1, "the destination exists"},
        {Reason::EmptyFile, "empty-file", 8, "empty file"},
        {Reason::NotAMovie, "not-a-movie", 8, "not a QuickTime/ISO movie"},
        {Reason::WrongBrand, "wrong-brand", 8, "not a camera movie (brand '{}')"},
        {Reason::MalformedAtom, "malformed-atom", 8, "malformed atom"},
        {Reason::Truncated, "truncated", 8, "truncated: {} present"},
        {Reason::Fragmented, "fragmented", 8, "fragmented movie"},
        {Reason::NoSoundTrack, "no-sound-track", 8, "no sound track"},
        {Reason::UnsupportedSound, "unsupported-sound", 8, "unsupported sound"},
        {Reason::UnsupportedLayout, "unsupported-layout", 8, "unsupported layout"},
        {Reason::NoAFInformation, "no-af-information", 8, "no AF information"},
        {Reason::AlreadyProcessed, "already-processed", 20, "already processed"},
        {Reason::AlreadyInOutput, "already-in-output", -1, "already in {}"},
        {Reason::NoSpace, "no-space", 130, "not enough free space on the destination's volume"},
        {Reason::FileTooLarge, "file-too-large", 131, "the destination's file system cannot hold a file that large"},
        {Reason::OutOfMemory, "out-of-memory", 100, "out of memory"},
        {Reason::LibraryRefusedAF, "af-information-unusable", 9,
         "the processing library cannot use the AF information"},
        {Reason::WriteFailed, "write-failed", 190, "the destination could not be written"},
        {Reason::Internal, "internal", 190, "internal error"},
    };
    return table;
}

bool AboutDestination(Reason reason)
{
    switch (reason) {
    case Reason::SameFile:
    case Reason::DestinationIsDirectory:
    case Reason::DestinationDirectoryMissing:
    case Reason::DestinationAccessDenied:
    case Reason::DestinationExists:
    case Reason::NoSpace:
    case Reason::FileTooLarge:
    case Reason::WriteFailed: return true;
    default: return false;
    }
}

const char* Verdict::Key() const { return Row(reason).key; }

int Verdict::Result() const { return reason == Reason::None || reason == Reason::Internal ? code : Row(reason).code; }

Verdict MakeVerdict(int code, Reason reason, const std::string& detail)
{
    Verdict verdict{code, reason, Row(reason).words};
    const size_t slot = verdict.text.find("{}");
    if (slot != std::string::npos) {
        verdict.text.replace(slot, 2, detail);
    } else if (!detail.empty()) {
        verdict.text += ": " + detail;
    }
    return verdict;
}

Verdict DestinationVerdict(const std::string& source, const std::string& destination, bool replace)
{
    struct stat status {};
    if (stat(destination.c_str(), &status) == 0) {
        struct stat sourceStatus {};
        if (S_ISDIR(status.st_mode)) {
            return MakeVerdict(190, Reason::DestinationIsDirectory);
        }
        if (stat(source.c_str(), &sourceStatus) == 0 && sourceStatus.st_dev == status.st_dev &&
            sourceStatus.st_ino == status.st_ino) {
            return MakeVerdict(190, Reason::SameFile);
        }
    }
    // A dangling link is a name taken too.
    const bool taken = lstat(destination.c_str(), &status) == 0;
    return taken && !replace ? MakeVerdict(-1, Reason::DestinationExists) : Verdict{};
}

Verdict CheckDestination(const std::string& source, const std::string& destination, bool replace)
{
    Verdict verdict = DestinationVerdict(source, destination, replace);
    if (verdict.reason == Reason::DestinationExists) {
        verdict.text += " (use --force to replace it)";
    }
    return verdict;
}

std::string AacWholeReason(const std::string& source)
{
    CTqovixMovControl control;
    const bool opened = !TqovixFailed(control.Initialize(source.c_str(), nullptr));
    std::string reason = opened ? control.GetAacWholeReason() : std::string();
    control.Close();
    return reason;
}

Verdict Explain(int code, const std::string& source, const std::string& destination)
{
    if (code == 0) {
        return {};
    }
    if (code == 200) {
        return MakeVerdict(code, Reason::Aborted);
    }
    // The paths first: the library's answer to them is one of a few codes.
    struct stat sourceStatus {};
    if (stat(source.c_str(), &sourceStatus) != 0) {
        const int error = errno;
        return error == ENOENT || error == ENOTDIR ? MakeVerdict(code, Reason::SourceMissing)
                                                   : MakeVerdict(code, Reason::SourceAccessDenied, std::strerror(error));
    }
    if (S_ISDIR(sourceStatus.st_mode)) {
        return MakeVerdict(code, Reason::SourceIsDirectory);
    }
    // A FIFO or a device: the library refused it without opening it for good, and so must we
    // (reading one to explain it would wait on it).
    if (!S_ISREG(sourceStatus.st_mode)) {
        return MakeVerdict(code, Reason::SourceNotRegularFile);
    }
    if (access(source.c_str(), R_OK) != 0) {
        return MakeVerdict(code, Reason::SourceAccessDenied, std::strerror(errno));
    }
    if (!destination.empty()) {
        struct stat status {};
        if (stat(destination.c_str(), &status) == 0) {
            if (S_ISDIR(status.st_mode)) {
                return MakeVerdict(code, Reason::DestinationIsDirectory);
            }
            if (status.st_dev == sourceStatus.st_dev && status.st_ino == sourceStatus.st_ino) {
                return MakeVerdict(code, Reason::SameFile);
            }
        }
        const std::string directory = DirectoryOf(destination);
        if (stat(directory.c_str(), &status) != 0 || !S_ISDIR(status.st_mode)) {
            return MakeVerdict(code, Reason::DestinationDirectoryMissing);
        }
        if (access(directory.c_str(), W_OK | X_OK) != 0) {
            return MakeVerdict(code, Reason::DestinationAccessDenied, std::strerror(errno));
        }
        if (code == 130) {
            struct statvfs volume {};
            const bool measured = statvfs(directory.c_str(), &volume) == 0;
            // The library measures the room before it writes: a volume that takes no files
            // (mounted read-only, or a system one such as /proc) has none, and that is its fault.
            if (measured && (volume.f_flag & ST_RDONLY) != 0) {
                return MakeVerdict(code, Reason::DestinationAccessDenied, std::strerror(EROFS));
            }
            if (measured && volume.f_blocks == 0) {
                return MakeVerdict(code, Reason::DestinationAccessDenied, "its volume stores no files");
            }
            const unsigned long long free = measured ? 1ULL * volume.f_bavail * volume.f_frsize : 0;
            const auto needed = static_cast<uint64_t>(sourceStatus.st_size);
            return MakeVerdict(code, Reason::NoSpace,
                               "about " + SizeText(needed) + " needed, " + SizeText(free) + " free (" +
                                   SizeText(needed > free ? needed - free : 0) + " missing)");
        }
    }
    switch (code) {
    case 20: return MakeVerdict(code, Reason::AlreadyProcessed);
    case 100: return MakeVerdict(code, Reason::OutOfMemory);
    case 110: return MakeVerdict(code, Reason::SourceMissing);
    case 111: return MakeVerdict(code, Reason::DestinationDirectoryMissing);
    case 120: return MakeVerdict(code, Reason::SourceAccessDenied);
    case 121: return MakeVerdict(code, Reason::DestinationAccessDenied);
    case 130: return MakeVerdict(code, Reason::NoSpace);
    case 131: return MakeVerdict(code, Reason::FileTooLarge);
    case 7:
    case 9: return MakeVerdict(code, Reason::LibraryRefusedAF);
    default: return ExplainContent(code, source);
    }
}

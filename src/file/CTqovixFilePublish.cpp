// Publishing: what appears under the user's name, and only once the destination is complete.
#ifndef _FILE_OFFSET_BITS
#define _FILE_OFFSET_BITS 64
#endif

#include "file/CTqovixFile.h"
#include "file/TqovixFileInternal.h"

#include <atomic>
#include <cerrno>
#include <fcntl.h>
#include <string>
#include <sys/stat.h>
#include <unistd.h>

using TqovixFileInternal::InjectedFault;
using TqovixFileInternal::IsEmptyPath;

namespace {

std::atomic<bool> g_bUnnamedDestinations{true};

std::string DirectoryOf(const std::string& path)
{
    const size_t slash = path.rfind('/');
    return slash == std::string::npos ? "." : slash == 0 ? "/" : path.substr(0, slash);
}

// What one name in a directory may take on the file systems a camera's card or a disk carries.
constexpr size_t kLongestName = 255;

// ".NAME.PID-N.tqovix-partial" beside `path`: hidden, and plainly ours. A long NAME is cut to
// what the rest leaves room for (at a character's start), so a name that fits has a hidden one.
std::string PartialNameFor(const std::string& path)
{
    static std::atomic<unsigned> s_counter{0};
    const size_t slash = path.rfind('/');
    std::string name = slash == std::string::npos ? path : path.substr(slash + 1);
    // Appended piece by piece: g++ 12 warns falsely on a chain of + that starts with a literal.
    std::string tail(1, '.');
    tail.append(std::to_string(getpid())).append(1, '-').append(std::to_string(++s_counter));
    tail.append(CTqovixFile::kPartialSuffix);
    const size_t room = kLongestName - 1 - tail.size();
    if (name.size() > room) {
        size_t cut = room;
        while (cut > 0 && (static_cast<unsigned char>(name[cut]) & 0xC0) == 0x80) {
            --cut;  // a UTF-8 continuation byte: the character began before it
        }
        name.resize(cut);
    }
    return DirectoryOf(path) + "/." + name + tail;
}

// The system calls that name and sync a destination, as the calls themselves answer (-1 with
// errno), so that the seam's error takes the very path a real one takes. A seam's -1 (a short
// write elsewhere) has no meaning here and stands for EIO.
int Failed(int fault)
{
    errno = fault > 0 ? fault : EIO;
    return -1;
}

int Link(const std::string& from, const std::string& to)
{
    if (const int fault = InjectedFault(eTqovixFileOperation::Link)) {
        return Failed(fault);
    }
    return linkat(AT_FDCWD, from.c_str(), AT_FDCWD, to.c_str(), AT_SYMLINK_FOLLOW);
}

int Rename(const std::string& from, const std::string& to)
{
    if (const int fault = InjectedFault(eTqovixFileOperation::Rename)) {
        return Failed(fault);
    }
    return rename(from.c_str(), to.c_str());
}

int Sync(int descriptor)
{
    if (const int fault = InjectedFault(eTqovixFileOperation::Sync)) {
        return Failed(fault);
    }
    return fsync(descriptor);
}


}  // namespace

eTqovixErrorCode CTqovixFile::OpenDestination(const char* path)
{
    if (m_bOpened) {
        return eTqovixErrorInternal;
    }
    if (IsEmptyPath(path)) {
        return eTqovixErrorGeneral;
    }
    const std::string finalPath = path;
    struct stat status {};
    if (stat(path, &status) == 0 && S_ISDIR(status.st_mode)) {
        return eTqovixErrorIsDirectory;
    }
    if (const int fault = InjectedFault(eTqovixFileOperation::Open)) {
        return ConvertErrnoToLocalError(fault, false);
    }
    int descriptor = -1;
    // Unnamed files are named through /proc, which a container may lack.
    if (g_bUnnamedDestinations.load() && access("/proc/self/fd", X_OK) == 0) {
        descriptor = open(DirectoryOf(finalPath).c_str(), O_TMPFILE | O_RDWR | O_CLOEXEC, 0666);
    }
    std::string partial;
    if (descriptor < 0) {
        // No unnamed files here (or not wanted): a hidden name that says what it is.
        partial = PartialNameFor(finalPath);
        descriptor = open(partial.c_str(), O_CREAT | O_EXCL | O_RDWR | O_CLOEXEC, 0666);
        if (descriptor < 0) {
            return ConvertErrnoToLocalError(errno, false);
        }
    }
    FILE* stream = fdopen(descriptor, "w+");
    if (stream == nullptr) {
        const int error = errno;
        close(descriptor);
        if (!partial.empty()) {
            unlink(partial.c_str());
        }
        return ConvertErrnoToLocalError(error, false);
    }
    Adopt(stream);
    m_bReadOnly = false;
    m_finalPath = finalPath;
    m_partialPath = partial;
    m_bUnpublished = true;
    return eTqovixSuccess;
}

eTqovixErrorCode CTqovixFile::Publish(bool durable, const CTqovixFile* datesOf)
{
    if (!m_bUnpublished || m_stream == nullptr) {
        return eTqovixErrorInternal;
    }
    eTqovixErrorCode result = Flush();
    if (TqovixFailed(result)) {
        return result;
    }
    const int descriptor = fileno(m_stream);
    // After the last write, which would move the modification time on again. A file system
    // that keeps no such times is no reason to fail the job.
    if (datesOf != nullptr && datesOf->m_bTimesKnown) {
        futimens(descriptor, datesOf->m_openedTimes);
    }
    if (durable && Sync(descriptor) != 0) {
        return ConvertErrnoToLocalError(errno, false);
    }
    bool named = false;
    if (m_partialPath.empty()) {
        const std::string self = "/proc/self/fd/" + std::to_string(descriptor);
        // A free name is given in one step; a name taken can only be replaced by rename, so the
        // file gets a hidden name first (a complete movie, left only if killed between the two).
        named = Link(self, m_finalPath) == 0;
        if (!named && errno != EEXIST) {
            return ConvertErrnoToLocalError(errno, false);
        }
        if (!named) {
            const std::string hidden = PartialNameFor(m_finalPath);
            if (Link(self, hidden) != 0) {
                return ConvertErrnoToLocalError(errno, false);
            }
            m_partialPath = hidden;
        }
    }
    if (!named && Rename(m_partialPath, m_finalPath) != 0) {
        return ConvertErrnoToLocalError(errno, false);
    }
    m_partialPath.clear();
    m_bUnpublished = false;
    if (durable) {
        const int directoryDescriptor = open(DirectoryOf(m_finalPath).c_str(), O_RDONLY | O_DIRECTORY | O_CLOEXEC);
        if (directoryDescriptor >= 0) {
            result = Sync(directoryDescriptor) == 0 ? eTqovixSuccess : ConvertErrnoToLocalError(errno, false);
            close(directoryDescriptor);
        }
    }
    return result;
}

bool CTqovixFile::SetUnnamedDestinations(bool enabled)
{
    return g_bUnnamedDestinations.exchange(enabled);
}

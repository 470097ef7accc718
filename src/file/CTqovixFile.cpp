// Movies larger than 4 GiB are the norm, so positions must never pass through a 32-bit off_t.
#ifndef _FILE_OFFSET_BITS
#define _FILE_OFFSET_BITS 64
#endif

#include "file/CTqovixFile.h"

#include <algorithm>
#include <atomic>
#include <cerrno>
#include <cstring>
#include <new>
#include <fcntl.h>
#include <libgen.h>
#include <linux/fs.h>
#include <linux/magic.h>
#include <sys/ioctl.h>
#include <sys/stat.h>
#include <sys/statfs.h>
#include <sys/types.h>
#include <unistd.h>
#include <vector>

static_assert(sizeof(off_t) == 8, "file positions must be 64-bit");

namespace {

#ifndef EXFAT_SUPER_MAGIC
#define EXFAT_SUPER_MAGIC 0x2011BAB0
#endif
constexpr uint32_t kNtfsMagic = 0x5346544e;  // ntfs3 and ntfs-3g's kernel side
constexpr uint32_t kZfsMagic = 0x2fc12fc1;

struct FileSystemName {
    uint32_t magic;
    const char* name;
};

// Only MSDOS_SUPER_MAGIC changes a decision; the rest names the volume for diagnostics.
constexpr FileSystemName kFileSystemNames[] = {
    {MSDOS_SUPER_MAGIC, "msdos"},
    {EXT4_SUPER_MAGIC, "ext4"},  // ext2 and ext3 share the magic
    {TMPFS_MAGIC, "tmpfs"},
    {RAMFS_MAGIC, "ramfs"},
    {XFS_SUPER_MAGIC, "xfs"},
    {BTRFS_SUPER_MAGIC, "btrfs"},
    {EXFAT_SUPER_MAGIC, "exfat"},
    {F2FS_SUPER_MAGIC, "f2fs"},
    {kNtfsMagic, "ntfs"},
    {kZfsMagic, "zfs"},
    {OVERLAYFS_SUPER_MAGIC, "overlay"},
    {FUSE_SUPER_MAGIC, "fuse"},
    {NFS_SUPER_MAGIC, "nfs"},
    {CIFS_SUPER_MAGIC, "cifs"},
    {SMB2_SUPER_MAGIC, "smb2"},
    {SQUASHFS_MAGIC, "squashfs"},
    {ISOFS_SUPER_MAGIC, "iso9660"},
    {PROC_SUPER_MAGIC, "proc"},
    {SYSFS_MAGIC, "sysfs"},
};

const char* FileSystemTypeName(uint32_t magic)
{
    for (const FileSystemName& entry : kFileSystemNames) {
        if (entry.magic == magic) {
            return entry.name;
        }
    }
    return "unknown";
}

std::atomic<TqovixVolumeQuery> g_volumeQuery{&CTqovixFile::QueryVolume};
std::atomic<TqovixFaultHook> g_faultHook{nullptr};

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
    const std::string tail = "." + std::to_string(getpid()) + "-" + std::to_string(++s_counter) +
                             CTqovixFile::kPartialSuffix;
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

int InjectedFault(eTqovixFileOperation operation)
{
    const TqovixFaultHook hook = g_faultHook.load(std::memory_order_relaxed);
    return hook == nullptr ? 0 : hook(operation);
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

// A 4 GiB file cannot exist on FAT: its size field is 32 bits wide.
constexpr double kMsdosLargestFile = 4294967295.0;

constexpr size_t kStreamBuffer = 256 * 1024;

bool IsEmptyPath(const char* path) { return path == nullptr || path[0] == '\0'; }

}  // namespace

CTqovixFile::~CTqovixFile()
{
    Close();
}

eTqovixErrorCode CTqovixFile::Open(const char* path, int mode)
{
    if (m_bOpened) {
        // Reopening would leak the held stream; callers close first.
        return eTqovixErrorInternal;
    }
    if (IsEmptyPath(path)) {
        if (mode == 1) {
            return eTqovixErrorSourceNotFound;
        }
        return mode == 2 ? eTqovixErrorGeneral : eTqovixErrorInternal;
    }

    if (mode == 1) {
        if (access(path, R_OK) != 0) {
            return ConvertErrnoToLocalError(errno, m_bReadOnly);
        }
        m_bReadOnly = true;
        return OpenSource(path);
    }
    m_bReadOnly = false;
    if (const int fault = InjectedFault(eTqovixFileOperation::Open)) {
        return ConvertErrnoToLocalError(fault, m_bReadOnly);
    }
    // "e" keeps the descriptor out of processes a host may spawn while a job runs.
    FILE* stream = std::fopen(path, "w+e");
    if (stream == nullptr) {
        return ConvertErrnoToLocalError(errno, m_bReadOnly);
    }
    Adopt(stream);
    return eTqovixSuccess;
}

eTqovixErrorCode CTqovixFile::OpenSource(const char* path)
{
    if (const int fault = InjectedFault(eTqovixFileOperation::Open)) {
        return ConvertErrnoToLocalError(fault, true);
    }
    // Opening a FIFO waits for a writer that may never come, and a device reads forever or
    // not at all: without O_NONBLOCK the open returns at once whatever the path names, and
    // what it names is looked at on the descriptor itself, not through a second lookup.
    const int descriptor = open(path, O_RDONLY | O_NONBLOCK | O_CLOEXEC);
    if (descriptor < 0) {
        return ConvertErrnoToLocalError(errno, true);
    }
    struct stat status {};
    eTqovixErrorCode refusal = eTqovixSuccess;
    if (fstat(descriptor, &status) != 0) {
        refusal = ConvertErrnoToLocalError(errno, true);
    } else if (S_ISDIR(status.st_mode)) {
        refusal = eTqovixErrorIsDirectory;
    } else if (!S_ISREG(status.st_mode)) {
        refusal = eTqovixErrorSourceNotFound;  // not a file to read a movie from
    } else {
        const int flags = fcntl(descriptor, F_GETFL);
        if (flags < 0 || fcntl(descriptor, F_SETFL, flags & ~O_NONBLOCK) != 0) {
            refusal = ConvertErrnoToLocalError(errno, true);
        }
    }
    FILE* stream = TqovixFailed(refusal) ? nullptr : fdopen(descriptor, "r");
    if (stream == nullptr) {
        const int error = errno;
        close(descriptor);
        return TqovixFailed(refusal) ? refusal : ConvertErrnoToLocalError(error, true);
    }
    Adopt(stream);
    return eTqovixSuccess;
}

void CTqovixFile::Adopt(FILE* stream)
{
    // The default buffer of one block makes a syscall per 4 KiB of sound.
    m_buffer.reset(new (std::nothrow) char[kStreamBuffer]);
    if (m_buffer != nullptr) {
        setvbuf(stream, m_buffer.get(), _IOFBF, kStreamBuffer);
    }
    m_stream = stream;
    // Kept apart from the stream: the kernel copy and positioned reads use it from other
    // threads, where the stream's own fields are not theirs to read.
    m_descriptor = fileno(stream);
    m_bOpened = true;
}

void CTqovixFile::Close()
{
    if (m_stream != nullptr) {
        std::fclose(m_stream);
        m_stream = nullptr;
    }
    m_descriptor = -1;
    // An unnamed destination vanishes with its descriptor; a hidden one is removed.
    if (m_bUnpublished && !m_partialPath.empty()) {
        unlink(m_partialPath.c_str());
    }
    m_bUnpublished = false;
    m_partialPath.clear();
    m_finalPath.clear();
    m_buffer.reset();
    m_bOpened = false;
}

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

eTqovixErrorCode CTqovixFile::Publish(bool durable)
{
    if (!m_bUnpublished || m_stream == nullptr) {
        return eTqovixErrorInternal;
    }
    eTqovixErrorCode result = Flush();
    if (TqovixFailed(result)) {
        return result;
    }
    const int descriptor = fileno(m_stream);
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

eTqovixErrorCode CTqovixFile::Read(void* buffer, unsigned int* readSize, unsigned int size)
{
    if (readSize == nullptr) {
        return eTqovixErrorInternal;
    }
    *readSize = 0;
    if (size == 0) {
        return eTqovixSuccess;
    }
    if (m_stream == nullptr || buffer == nullptr) {
        return eTqovixErrorInternal;
    }

    if (const int fault = InjectedFault(eTqovixFileOperation::Read)) {
        return ConvertErrnoToLocalError(fault, m_bReadOnly);
    }
    // Single-byte items, so a partial read reports its exact count.
    const size_t count = std::fread(buffer, 1, size, m_stream);
    const int error = errno;
    *readSize = static_cast<unsigned int>(count);
    if (count < size && !std::feof(m_stream) && std::ferror(m_stream)) {
        std::clearerr(m_stream);
        return ConvertErrnoToLocalError(error, m_bReadOnly);
    }
    return eTqovixSuccess;
}

eTqovixErrorCode CTqovixFile::Write(const void* buffer, unsigned int size)
{
    if (size == 0) {
        return eTqovixSuccess;
    }
    if (m_stream == nullptr || buffer == nullptr) {
        return eTqovixErrorInternal;
    }

    const int fault = InjectedFault(eTqovixFileOperation::Write);
    if (fault > 0) {
        return ConvertErrnoToLocalError(fault, m_bReadOnly);
    }
    errno = 0;
    // The seam's -1: the write comes back short with no reason given, as a stream may.
    if (fault == 0 && std::fwrite(buffer, size, 1, m_stream) == 1) {
        return eTqovixSuccess;
    }
    const int error = errno;
    if (std::feof(m_stream)) {
        return eTqovixErrorEndOfFile;
    }
    std::clearerr(m_stream);
    // A write that wrote less than asked failed, whether or not the stream says why.
    return error != 0 ? ConvertErrnoToLocalError(error, m_bReadOnly) : eTqovixErrorDevice;
}

eTqovixErrorCode CTqovixFile::Flush()
{
    if (m_stream == nullptr) {
        return eTqovixErrorInternal;
    }
    if (const int fault = InjectedFault(eTqovixFileOperation::Flush)) {
        return ConvertErrnoToLocalError(fault, m_bReadOnly);
    }
    return FlushStream();
}

eTqovixErrorCode CTqovixFile::FlushStream()
{
    if (std::fflush(m_stream) != 0) {
        const int error = errno;
        std::clearerr(m_stream);
        return ConvertErrnoToLocalError(error, m_bReadOnly);
    }
    return eTqovixSuccess;
}

eTqovixErrorCode CTqovixFile::CopyFrom(CTqovixFile& source, unsigned long long size, bool* copied)
{
    if (copied == nullptr || m_stream == nullptr || source.m_stream == nullptr) {
        return eTqovixErrorInternal;
    }
    *copied = false;
    if (m_bKernelCopyRefused) {
        return eTqovixSuccess;
    }
    // Our buffered bytes go first; both streams' positions include what they buffer.
    if (const eTqovixErrorCode flushed = FlushStream(); TqovixFailed(flushed)) {
        return flushed;
    }
    const off_t in = ftello(source.m_stream);
    const off_t out = ftello(m_stream);
    if (in < 0 || out < 0) {
        return ConvertErrnoToLocalError(errno, false);
    }
    const eTqovixErrorCode result = CopyRange(source, static_cast<unsigned long long>(in),
                                              static_cast<unsigned long long>(out), size, copied, nullptr);
    if (TqovixFailed(result) || !*copied) {
        return result;
    }
    // The descriptors' own offsets never moved; the streams are put where the copy ended.
    if (fseeko(source.m_stream, in + static_cast<off_t>(size), SEEK_SET) != 0 ||
        fseeko(m_stream, out + static_cast<off_t>(size), SEEK_SET) != 0) {
        return ConvertErrnoToLocalError(errno, false);
    }
    return eTqovixSuccess;
}

eTqovixErrorCode CTqovixFile::CopyRange(CTqovixFile& source, unsigned long long from, unsigned long long to,
                                        unsigned long long size, bool* copied, const std::atomic<bool>* cancel,
                                        std::atomic<unsigned long long>* reached)
{
    if (copied == nullptr || m_stream == nullptr || source.m_stream == nullptr) {
        return eTqovixErrorInternal;
    }
    *copied = false;
    if (m_bKernelCopyRefused) {
        return eTqovixSuccess;
    }
    if (const int fault = InjectedFault(eTqovixFileOperation::Read)) {
        return ConvertErrnoToLocalError(fault, true);
    }
    if (const int fault = InjectedFault(eTqovixFileOperation::Write)) {
        return ConvertErrnoToLocalError(fault, false);
    }
    // Pieces, so that a copy asked to stop stops soon.
    constexpr unsigned long long kPiece = 16ULL << 20;
    auto in = static_cast<off_t>(from);
    auto out = static_cast<off_t>(to);
    unsigned long long left = size;
    while (left > 0) {
        if (cancel != nullptr && cancel->load(std::memory_order_relaxed)) {
            return eTqovixErrorAborted;
        }
        const ssize_t done =
            copy_file_range(source.m_descriptor, &in, m_descriptor, &out, std::min(left, kPiece), 0);
        if (done < 0) {
            const int error = errno;
            if (error == EINTR) {
                continue;
            }
            // Files the kernel cannot copy between (other file systems, old kernels, pipes).
            const bool refused = error == EXDEV || error == EINVAL || error == ENOSYS || error == EOPNOTSUPP ||
                                 error == EBADF;
            if (refused && left == size) {
                m_bKernelCopyRefused = true;
                return eTqovixSuccess;
            }
            return ConvertErrnoToLocalError(error, false);
        }
        if (done == 0) {
            // The caller checked the range against the file size: the source shrank meanwhile.
            return eTqovixErrorInternal;
        }
        left -= static_cast<unsigned long long>(done);
        if (reached != nullptr) {
            reached->store(static_cast<unsigned long long>(out), std::memory_order_release);
        }
    }
    *copied = true;
    return eTqovixSuccess;
}

eTqovixErrorCode CTqovixFile::GetPosition(long long* position) const
{
    if (m_stream == nullptr || position == nullptr) {
        return eTqovixErrorInternal;
    }
    if (const int fault = InjectedFault(eTqovixFileOperation::Position)) {
        return ConvertErrnoToLocalError(fault, m_bReadOnly);
    }
    const off_t current = ftello(m_stream);
    if (current < 0) {
        return ConvertErrnoToLocalError(errno, m_bReadOnly);
    }
    *position = current;
    return eTqovixSuccess;
}

eTqovixErrorCode CTqovixFile::Seek(long long offset, eTqovixSeek origin)
{
    if (m_stream == nullptr) {
        return eTqovixErrorInternal;
    }
    if (const int fault = InjectedFault(eTqovixFileOperation::Seek)) {
        return ConvertErrnoToLocalError(fault, m_bReadOnly);
    }
    if (fseeko(m_stream, static_cast<off_t>(offset), origin) != 0) {
        return ConvertErrnoToLocalError(errno, m_bReadOnly);
    }
    return eTqovixSuccess;
}

eTqovixErrorCode CTqovixFile::GetFileSize(long long* size)
{
    if (size == nullptr) {
        return eTqovixErrorInternal;
    }
    long long position = 0;
    eTqovixErrorCode code = GetPosition(&position);
    if (TqovixFailed(code)) {
        return code;
    }
    code = Seek(0, eTqovixSeekEnd);
    if (TqovixFailed(code)) {
        return code;
    }
    code = GetPosition(size);
    if (TqovixFailed(code)) {
        return code;
    }
    return Seek(position, eTqovixSeekBegin);
}

eTqovixErrorCode CTqovixFile::SetFileSize(long long size)
{
    if (m_stream == nullptr) {
        return eTqovixErrorInternal;
    }
    // Bytes still in the stream's buffer would land after the truncation and
    // re-extend the file; a read buffer could hold bytes that no longer exist.
    if (std::fflush(m_stream) != 0) {
        const int error = errno;
        std::clearerr(m_stream);
        return ConvertErrnoToLocalError(error, m_bReadOnly);
    }
    if (const int fault = InjectedFault(eTqovixFileOperation::Truncate)) {
        return ConvertErrnoToLocalError(fault, m_bReadOnly);
    }
    if (ftruncate(fileno(m_stream), static_cast<off_t>(size)) != 0) {
        return ConvertErrnoToLocalError(errno, m_bReadOnly);
    }
    return eTqovixSuccess;
}

TqovixFaultHook CTqovixFile::SetFaultHook(TqovixFaultHook hook) { return g_faultHook.exchange(hook); }

eTqovixErrorCode CTqovixFile::ComfirmWritable(long long size, const char* path)
{
    if (IsEmptyPath(path)) {
        return eTqovixErrorGeneral;
    }

    // dirname may write into its argument.
    std::vector<char> copy(path, path + std::strlen(path) + 1);
    const char* directory = dirname(copy.data());

    TqovixVolumeInformation information;
    const TqovixVolumeQuery query = g_volumeQuery.load();
    if (!query(directory, &information)) {
        return eTqovixErrorDestinationNotFound;
    }

    const uint64_t availableBytes = static_cast<uint64_t>(information.blockSize) * information.blocksAvailable;
    const double available = static_cast<double>(availableBytes);
    const double required = static_cast<double>(size) * 0.9;
    // FAT cannot hold the destination if the source's size does not fit it: the estimate
    // that serves for free space would let 4.0 to 4.44 GiB through to fail half-way.
    if (information.typeName == "msdos" && static_cast<double>(size) >= kMsdosLargestFile) {
        return eTqovixErrorFileTooLarge;
    }
    if (required >= available) {
        return eTqovixErrorDiskFull;
    }
    return eTqovixSuccess;
}

eTqovixErrorCode CTqovixFile::Delete(const char* path)
{
    if (IsEmptyPath(path)) {
        return eTqovixErrorGeneral;
    }
    if (unlink(path) != 0) {
        return ConvertErrnoToLocalError(errno, false);
    }
    return eTqovixSuccess;
}

eTqovixErrorCode CTqovixFile::ConvertErrnoToLocalError(int errorNumber, bool readOnly)
{
    switch (errorNumber) {
    case EPERM:
    case EACCES:
        return readOnly ? eTqovixErrorSourceAccessDenied : eTqovixErrorDestinationAccessDenied;
    case EROFS:
    case ETXTBSY:
        // Only opening for writing meets these: what cannot be written is the destination.
        return eTqovixErrorDestinationAccessDenied;
    case ENOENT:
    case ENOTDIR:
    case ENAMETOOLONG:
    case ELOOP:
        // A name the system cannot follow to a file: not found, or not to be created.
        return readOnly ? eTqovixErrorSourceNotFound : eTqovixErrorDestinationNotFound;
    case ENOMEM:
        return eTqovixErrorOutOfMemory;
    case ENOSPC:
    case EDQUOT:
        return eTqovixErrorDiskFull;
    case EEXIST:
        return eTqovixErrorFileExists;
    case ENFILE:
    case EMFILE:
        return eTqovixErrorTooManyFiles;
    case EISDIR:
        return eTqovixErrorIsDirectory;
    case EFBIG:
        return eTqovixErrorFileTooLarge;  // the volume cannot hold a file that large
    case E2BIG:
    case EINVAL:
    case ESPIPE:
    case EDOM:
    case EOVERFLOW:
        return eTqovixErrorInvalidArgument;
    case ENXIO:
    case ENOTBLK:
    case EBUSY:
    case EXDEV:
    case ENODEV:
#ifdef EPWROFF
    case EPWROFF:
#endif
#ifdef EDEVERR
    case EDEVERR:
#endif
        return eTqovixErrorDevice;
    case ENOTEMPTY:
        return eTqovixErrorInternal;
    default:
        break;
    }
    // EHWPOISON is the highest error number Linux defines.
    if (errorNumber >= 1 && errorNumber <= EHWPOISON) {
        return eTqovixErrorGeneral;
    }
    return eTqovixErrorInternal;
}

TqovixVolumeQuery CTqovixFile::SetVolumeQuery(TqovixVolumeQuery query)
{
    return g_volumeQuery.exchange(query != nullptr ? query : &CTqovixFile::QueryVolume);
}

bool CTqovixFile::QueryVolume(const char* directory, TqovixVolumeInformation* information)
{
    if (directory == nullptr || information == nullptr) {
        errno = EINVAL;
        return false;
    }
    struct statfs statistics;
    std::memset(&statistics, 0, sizeof statistics);
    if (statfs(directory, &statistics) != 0) {
        return false;
    }
    information->blockSize = static_cast<uint32_t>(statistics.f_bsize);
    information->blocksAvailable = static_cast<uint64_t>(statistics.f_bavail);
    information->typeName = FileSystemTypeName(static_cast<uint32_t>(statistics.f_type));
    return true;
}

eTqovixErrorCode CTqovixFile::ReadAt(unsigned long long offset, void* buffer, unsigned int size,
                                     unsigned int* readSize)
{
    if (readSize == nullptr || m_stream == nullptr || (buffer == nullptr && size != 0)) {
        return eTqovixErrorInternal;
    }
    *readSize = 0;
    if (const int fault = InjectedFault(eTqovixFileOperation::Read)) {
        return ConvertErrnoToLocalError(fault, m_bReadOnly);
    }
    auto* bytes = static_cast<uint8_t*>(buffer);
    while (*readSize < size) {
        const ssize_t got = pread(m_descriptor, bytes + *readSize, size - *readSize,
                                  static_cast<off_t>(offset + *readSize));
        if (got < 0 && errno == EINTR) {
            continue;
        }
        if (got < 0) {
            return ConvertErrnoToLocalError(errno, m_bReadOnly);
        }
        if (got == 0) {
            break;
        }
        *readSize += static_cast<unsigned int>(got);
    }
    return eTqovixSuccess;
}

void CTqovixFile::HintSmallCopyOnWrite()
{
    if (m_stream == nullptr) {
        return;
    }
    const int descriptor = fileno(m_stream);
    struct stat status {};
    fsxattr attributes {};
    if (fstat(descriptor, &status) != 0 || ioctl(descriptor, FS_IOC_FSGETXATTR, &attributes) != 0) {
        return;
    }
    attributes.fsx_xflags |= FS_XFLAG_COWEXTSIZE;
    attributes.fsx_cowextsize = static_cast<uint32_t>(status.st_blksize);
    ioctl(descriptor, FS_IOC_FSSETXATTR, &attributes);
}

// Streams, volume checks and error numbers (publishing: CTqovixFilePublish.cpp; kernel copy: CTqovixFileCopy.cpp).
// Movies larger than 4 GiB are the norm, so positions must never pass through a 32-bit off_t.
#ifndef _FILE_OFFSET_BITS
#define _FILE_OFFSET_BITS 64
#endif

#include "file/CTqovixFile.h"
#include "file/TqovixFileInternal.h"

#include <atomic>
#include <cerrno>
#include <cstring>
#include <new>
#include <fcntl.h>
#include <libgen.h>
#include <linux/magic.h>
#include <sys/stat.h>
#include <sys/statfs.h>
#include <sys/types.h>
#include <unistd.h>
#include <vector>

static_assert(sizeof(off_t) == 8, "file positions must be 64-bit");

using TqovixFileInternal::InjectedFault;
using TqovixFileInternal::IsEmptyPath;

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

// A 4 GiB file cannot exist on FAT: its size field is 32 bits wide.
constexpr double kMsdosLargestFile = 4294967295.0;

constexpr size_t kStreamBuffer = 256 * 1024;

}  // namespace

int TqovixFileInternal::InjectedFault(eTqovixFileOperation operation)
{
    const TqovixFaultHook hook = g_faultHook.load(std::memory_order_relaxed);
    return hook == nullptr ? 0 : hook(operation);
}

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
    // Before our reading can move the access time on.
    m_openedTimes[0] = status.st_atim;
    m_openedTimes[1] = status.st_mtim;
    m_bTimesKnown = true;
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
    m_bTimesKnown = false;
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

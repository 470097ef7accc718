// The kernel copy: byte ranges moved file to file without passing through our memory.
#ifndef _FILE_OFFSET_BITS
#define _FILE_OFFSET_BITS 64
#endif

#include "file/CTqovixFile.h"
#include "file/TqovixFileInternal.h"

#include <algorithm>
#include <atomic>
#include <cerrno>
#include <linux/fs.h>
#include <sys/ioctl.h>
#include <sys/stat.h>
#include <unistd.h>

using TqovixFileInternal::InjectedFault;

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

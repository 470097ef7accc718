// The one way the system touches a file's bytes: a buffered stream with 64-bit
// positions whose failures come back as eTqovixErrorCode, never as exceptions.
#pragma once

#include <atomic>
#include <ctime>
#include <cstdint>
#include <cstdio>
#include <memory>
#include <string>

#include "bridge/TqovixErrorCode.h"

// What ComfirmWritable needs to know about the destination's volume.
struct TqovixVolumeInformation {
    uint32_t blockSize = 0;
    uint64_t blocksAvailable = 0;
    std::string typeName;  // "msdos" for FAT volumes
};

// Fills the record for the volume holding `directory`; returns false with errno set on failure.
using TqovixVolumeQuery = bool (*)(const char* directory, TqovixVolumeInformation* information);

// The operations a fault seam can fail. Open: a source or a destination; Link and Rename: giving
// a destination its name (or its hidden one); Sync: the data, or the directory, reaching the device.
enum class eTqovixFileOperation { Read, Write, Seek, Position, Truncate, Flush, Open, Link, Rename, Sync };

// Answers an errno to fail the operation with, or 0 to let it run (for a write, -1: it comes
// back short without a reason). Tests use it to fail the Nth call of a whole job and check
// that nothing is lost or left behind.
using TqovixFaultHook = int (*)(eTqovixFileOperation operation);

class CTqovixFile {
public:
    enum eTqovixSeek { eTqovixSeekBegin = SEEK_SET, eTqovixSeekCurrent = SEEK_CUR, eTqovixSeekEnd = SEEK_END };

    CTqovixFile() = default;
    ~CTqovixFile();
    CTqovixFile(const CTqovixFile&) = delete;
    CTqovixFile& operator=(const CTqovixFile&) = delete;

    eTqovixErrorCode Open(const char* path, int mode);
    // A destination that has no name yet: an unnamed file in `path`'s directory where the file
    // system allows it, else a hidden one named ".NAME.ID" + kPartialSuffix there. It takes
    // `path` only through Publish; closing it unpublished removes it, and a process killed
    // meanwhile leaves nothing (or the recognisable hidden file) behind. `path` is not touched.
    eTqovixErrorCode OpenDestination(const char* path);
    // Flushes, then gives the destination its name, replacing what stood there in one step.
    // `durable`: the data, then the directory entry, reach the device first. `datesOf`, when
    // given, is an opened source whose modification and access times (as they were when it was
    // opened) the destination takes: importers and editors sort clips by them.
    eTqovixErrorCode Publish(bool durable, const CTqovixFile* datesOf = nullptr);
    // Closes; an unpublished destination is removed with it.
    void Close();
    bool IsOpened() const { return m_bOpened; }

    eTqovixErrorCode Read(void* buffer, unsigned int* readSize, unsigned int size);
    eTqovixErrorCode Write(const void* buffer, unsigned int size);
    eTqovixErrorCode GetPosition(long long* position) const;
    eTqovixErrorCode Seek(long long offset, eTqovixSeek origin);
    eTqovixErrorCode GetFileSize(long long* size);
    eTqovixErrorCode SetFileSize(long long size);
    // A buffered Write may succeed and the device refuse the bytes later: a writer
    // that must know its output reached the file calls this before Close.
    eTqovixErrorCode Flush();
    // Copies `size` bytes from the source's position to ours, both moving on, inside the
    // kernel: the bytes never visit our memory. *copied is false (and nothing moved) when
    // the two files do not allow it; the caller then copies through a buffer.
    eTqovixErrorCode CopyFrom(CTqovixFile& source, unsigned long long size, bool* copied);
    // The same between explicit offsets, by descriptors alone: neither stream moves, so the
    // copy may run on a thread of its own while the streams serve others. `cancel`, when
    // given, is looked at between pieces; a copy stopped so ends with 4608. `reached`, when
    // given, says after each piece where in our file the copied bytes end.
    eTqovixErrorCode CopyRange(CTqovixFile& source, unsigned long long from, unsigned long long to,
                               unsigned long long size, bool* copied, const std::atomic<bool>* cancel,
                               std::atomic<unsigned long long>* reached = nullptr);
    // Asks the file system to unshare no more than one block around a write into extents
    // this file shares with another (XFS's copy-on-write extent size). Where there is no
    // such setting nothing happens; it is only a hint.
    void HintSmallCopyOnWrite();
    // Reads at `offset` without moving or refilling the stream: for a look at bytes that the
    // stream's reader is not reading in order. Fewer bytes than asked only at the file's end.
    eTqovixErrorCode ReadAt(unsigned long long offset, void* buffer, unsigned int size, unsigned int* readSize);

    eTqovixErrorCode ComfirmWritable(long long size, const char* path);
    static eTqovixErrorCode Delete(const char* path);
    static eTqovixErrorCode ConvertErrnoToLocalError(int errorNumber, bool readOnly);

    // Replaces the volume query (tests use it to fake free space and FAT volumes);
    // null restores the real one. Returns the previous query.
    static TqovixVolumeQuery SetVolumeQuery(TqovixVolumeQuery query);
    // The real query (statfs); what a null SetVolumeQuery restores.
    static bool QueryVolume(const char* directory, TqovixVolumeInformation* information);
    // Installs a fault seam (null removes it); returns the previous one.
    static TqovixFaultHook SetFaultHook(TqovixFaultHook hook);
    // Off: destinations are hidden named files even where unnamed ones are possible (tests
    // of the fallback). Returns the previous setting.
    static bool SetUnnamedDestinations(bool enabled);
    // What ends the name of a destination not yet given its name.
    static constexpr const char* kPartialSuffix = ".tqovix-partial";

private:
    // The source: a regular file only, and never a wait for a FIFO's writer.
    eTqovixErrorCode OpenSource(const char* path);
    // fflush alone: the kernel copy must not count as a flush for the fault seam.
    eTqovixErrorCode FlushStream();
    // Takes an opened stream over, with our buffer.
    void Adopt(FILE* stream);

    bool m_bOpened = false;
    bool m_bReadOnly = true;
    bool m_bKernelCopyRefused = false;  // asked once per destination, not once per chunk
    std::string m_finalPath;      // a destination's name to be, until Publish gives it
    std::string m_partialPath;    // its hidden name meanwhile, when it has one
    bool m_bUnpublished = false;  // a destination not published yet
    FILE* m_stream = nullptr;
    int m_descriptor = -1;
    struct timespec m_openedTimes[2] = {};  // a source's access and modification times at opening
    bool m_bTimesKnown = false;
    std::unique_ptr<char[]> m_buffer;  // the stream's; outlives it
};

#include <gtest/gtest.h>

#include <algorithm>
#include <atomic>
#include <cerrno>
#include <climits>
#include <cstdio>
#include <cstring>
#include <fcntl.h>
#include <filesystem>
#include <ostream>
#include <string>
#include <sys/stat.h>
#include <sys/utsname.h>
#include <tuple>
#include <unistd.h>
#include <vector>

#include "bridge/TqovixCodeTable.h"
#include "file/CTqovixFile.h"
#include "file/CTqovixUtil.h"
#include "support/TestSupport.h"

namespace fs = std::filesystem;
using testsupport::TempDir;

namespace {

using testsupport::PrintTo;

constexpr long long kGiB = 1LL << 30;

std::vector<uint8_t> Pattern(size_t size, uint8_t seed)
{
    std::vector<uint8_t> bytes(size);
    for (size_t i = 0; i < size; ++i) {
        bytes[i] = static_cast<uint8_t>(seed + i * 13 + (i >> 8));
    }
    return bytes;
}

// Reads up to `size` bytes and returns those that arrived.
std::vector<uint8_t> ReadSome(CTqovixFile& file, unsigned int size)
{
    std::vector<uint8_t> buffer(size);
    unsigned int count = 99;
    EXPECT_EQ(file.Read(buffer.data(), &count, size), eTqovixSuccess);
    buffer.resize(std::min(count, size));
    return buffer;
}

TEST(FileOpen, UnusablePathsAndDelete)
{
    TempDir temp;
    const std::string missing = temp.File("missing.mov");
    const std::string orphan = temp.File("no-such-dir/out.mov");
    const fs::path saved = fs::current_path();  // a directory opened for reading becomes the working one
    const std::tuple<const char*, int, int> rows[] = {
        {"", 0, eTqovixErrorInternal}, {nullptr, 2, eTqovixErrorGeneral},
        {missing.c_str(), 1, eTqovixErrorSourceNotFound}, {orphan.c_str(), 2, eTqovixErrorDestinationNotFound},
        {temp.Path().c_str(), 1, eTqovixErrorIsDirectory}};
    for (const auto& [path, mode, expected] : rows) {
        CTqovixFile file;
        EXPECT_EQ(file.Open(path, mode), expected) << (path ? path : "null") << ", mode " << mode;
        EXPECT_FALSE(file.IsOpened());
    }
    fs::current_path(saved);
    EXPECT_EQ(CTqovixFile::Delete(nullptr), eTqovixErrorGeneral);
    EXPECT_EQ(CTqovixFile::Delete(missing.c_str()), eTqovixErrorDestinationNotFound);
    EXPECT_EQ(CTqovixFile::Delete(temp.Path().c_str()), eTqovixErrorIsDirectory);
}

// A small write only fills the stream's buffer; the device's refusal surfaces at the flush.
TEST(FileWrite, FullDeviceAtFlushAndPastTheBuffer)
{
    CTqovixFile file;
    ASSERT_EQ(file.Open("/dev/full", 2), eTqovixSuccess);
    const std::vector<uint8_t> bytes(1 << 20);
    EXPECT_EQ(file.Write(bytes.data(), 16), eTqovixSuccess);
    EXPECT_EQ(file.Flush(), eTqovixErrorDiskFull);
    EXPECT_EQ(file.Write(bytes.data(), 1 << 20), eTqovixErrorDiskFull);
}

// A write that comes back short without a reason (the seam's -1) failed all the same.
TEST(FileWrite, ShortWriteIsAnError)
{
    TempDir temp;
    CTqovixFile file;
    ASSERT_EQ(file.Open(temp.File("out.bin").c_str(), 2), eTqovixSuccess);
    const uint8_t bytes[4] = {1, 2, 3, 4};
    CTqovixFile::SetFaultHook([](eTqovixFileOperation operation) { return operation == eTqovixFileOperation::Write ? -1 : 0; });
    const eTqovixErrorCode result = file.Write(bytes, sizeof bytes);
    CTqovixFile::SetFaultHook(nullptr);
    EXPECT_TRUE(TqovixFailed(result)) << result;
    EXPECT_EQ(file.Write(bytes, sizeof bytes), eTqovixSuccess);
}

struct CopyRow {
    const char* name;
    bool otherVolume;  // where the kernel will not copy
};

class FileCopyTest : public ::testing::TestWithParam<CopyRow> {};

// A range copied file to file lands between what was written before and after it, and both
// streams move on; when the kernel will not copy (another volume), nothing moves at all.
TEST_P(FileCopyTest, CopiedRangeLandsWhereTheStreamsStand)
{
    TempDir temp;
    const std::vector<uint8_t> bytes = Pattern(600000, 5);
    const std::vector<uint8_t> header = Pattern(100, 9);
    const std::vector<uint8_t> trailer = Pattern(50, 77);
    if (GetParam().otherVolume && !fs::is_directory("/dev/shm")) {
        GTEST_SKIP() << "no /dev/shm to stand for another volume";
    }
    const std::string path = GetParam().otherVolume ? "/dev/shm/tqovix-file-test-" + std::to_string(getpid())
                                                    : temp.File("source.mov");
    struct Remove {
        const std::string& path;
        ~Remove() { unlink(path.c_str()); }
    } remove{path};
    ASSERT_TRUE(testsupport::WriteFile(path, bytes));
    const std::string destination = temp.File("destination.mov");
    CTqovixFile in;
    CTqovixFile out;
    ASSERT_EQ(in.Open(path.c_str(), 1), eTqovixSuccess);
    ASSERT_EQ(out.Open(destination.c_str(), 2), eTqovixSuccess);
    ASSERT_EQ(out.Write(header.data(), 100), eTqovixSuccess);  // still in the stream's buffer
    ASSERT_EQ(in.Seek(1000, CTqovixFile::eTqovixSeekBegin), eTqovixSuccess);
    EXPECT_EQ(ReadSome(in, 10), std::vector<uint8_t>(bytes.begin() + 1000, bytes.begin() + 1010));
    bool copied = false;
    ASSERT_EQ(out.CopyFrom(in, 500000, &copied), eTqovixSuccess);
    // One file system: the kernel copies. Two (tmpfs beside the test's directory): since Linux 5.19
    // the kernel refuses to copy between the superblocks of local file systems, so the bytes must
    // move through the streams instead.
    struct stat from {};
    struct stat to {};
    ASSERT_EQ(stat(path.c_str(), &from), 0);
    ASSERT_EQ(stat(destination.c_str(), &to), 0);
    utsname system {};
    int major = 0, minor = 0;
    const bool refusingKernel = uname(&system) == 0 && std::sscanf(system.release, "%d.%d", &major, &minor) == 2 &&
                                (major > 5 || (major == 5 && minor >= 19));
    if (from.st_dev == to.st_dev) {
        EXPECT_FALSE(GetParam().otherVolume) << "/dev/shm shares the test directory's file system: the row tests nothing";
        EXPECT_TRUE(copied) << "one file system: the kernel copies";
    } else if (refusingKernel) {
        EXPECT_FALSE(copied) << "two file systems: the kernel refuses to copy between them";
    }
    long long inAt = 0, outAt = 0;
    ASSERT_EQ(in.GetPosition(&inAt), eTqovixSuccess);
    ASSERT_EQ(out.GetPosition(&outAt), eTqovixSuccess);
    EXPECT_EQ(inAt, copied ? 501010 : 1010);
    EXPECT_EQ(outAt, copied ? 500100 : 100);
    if (!copied) {
        const std::vector<uint8_t> piece = ReadSome(in, 500000);
        ASSERT_EQ(out.Write(piece.data(), 500000), eTqovixSuccess);
    }
    EXPECT_EQ(ReadSome(in, 10), std::vector<uint8_t>(bytes.begin() + 501010, bytes.begin() + 501020));
    ASSERT_EQ(out.Write(trailer.data(), 50), eTqovixSuccess);
    ASSERT_EQ(out.Flush(), eTqovixSuccess);
    out.Close();
    // Built in a buffer of its final size: growing a copy of `header` trips an optimiser's
    // false out-of-bounds warning.
    std::vector<uint8_t> expected(header.size() + 500000 + trailer.size());
    std::copy(header.begin(), header.end(), expected.begin());
    std::copy(bytes.begin() + 1010, bytes.begin() + 501010, expected.begin() + 100);
    std::copy(trailer.begin(), trailer.end(), expected.end() - 50);
    EXPECT_EQ(testsupport::ReadFile(destination), expected);
}

INSTANTIATE_TEST_SUITE_P(Volumes, FileCopyTest,
                         ::testing::Values(CopyRow{"SameVolume", false}, CopyRow{"OtherVolume", true}),
                         testsupport::ByName);

// A volume the test describes, standing in for statfs.
TqovixVolumeInformation g_volume;
bool g_volumeFails = false;
std::string g_askedDirectory;

bool FakeVolume(const char* directory, TqovixVolumeInformation* out)
{
    g_askedDirectory = directory;
    *out = g_volume;
    errno = EACCES;
    return !g_volumeFails;
}

int Check(uint32_t blockSize, uint64_t blocks, const char* type, long long size, const char* path = "/volume/a.mov")
{
    g_volume = {blockSize, blocks, type};
    return CTqovixFile().ComfirmWritable(size, path);
}

struct VolumeRow {
    const char* name;
    uint32_t blockSize;
    uint64_t blocks;
    const char* type;
    long long size;
    eTqovixErrorCode expected;
};

class VolumeTest : public ::testing::TestWithParam<VolumeRow> {
protected:
    void SetUp() override { CTqovixFile::SetVolumeQuery(&FakeVolume); }
    void TearDown() override { CTqovixFile::SetVolumeQuery(nullptr); }
};

// Nine tenths of the source must fit, with room to spare; FAT cannot hold a file of 4 GiB, and
// the destination is the source's size: 4.0 to 4.44 GiB fail up front, not half-way.
TEST_P(VolumeTest, SourceMustFitTheDestinationsVolume)
{
    const VolumeRow& row = GetParam();
    EXPECT_EQ(Check(row.blockSize, row.blocks, row.type, row.size), row.expected);
}

INSTANTIATE_TEST_SUITE_P(
    FileComfirmWritable, VolumeTest,
    ::testing::Values(VolumeRow{"Fits", 1, 1000, "ext4", 1000, eTqovixSuccess},
                      VolumeRow{"NineTenthsShort", 1, 900, "ext4", 1000, eTqovixErrorDiskFull},
                      VolumeRow{"FewLargeBlocksShort", 100, 9, "ext4", 1000, eTqovixErrorDiskFull},
                      VolumeRow{"EightGiBAsA64BitProduct", 4096, 1ULL << 21, "ext4", 8 * kGiB, eTqovixSuccess},
                      VolumeRow{"FatJustUnder4GiB", 4096, 1ULL << 30, "msdos", 4 * kGiB - 2, eTqovixSuccess},
                      VolumeRow{"Fat4GiB", 4096, 1ULL << 30, "msdos", 4 * kGiB, eTqovixErrorFileTooLarge},
                      VolumeRow{"Fat4_3GiB", 4096, 1ULL << 30, "msdos", 43 * kGiB / 10, eTqovixErrorFileTooLarge},
                      VolumeRow{"Fat4_5GiB", 4096, 1ULL << 30, "msdos", 45 * kGiB / 10, eTqovixErrorFileTooLarge},
                      VolumeRow{"ExFat4_5GiB", 4096, 1ULL << 30, "exfat", 45 * kGiB / 10, eTqovixSuccess},
                      VolumeRow{"FatLimitBeforeSpace", 1, 1000, "msdos", 4 * kGiB, eTqovixErrorFileTooLarge}),
    testsupport::ByName);

TEST(FileComfirmWritable, ThroughTheVolumeSeamAndForReal)
{
    CTqovixFile::SetVolumeQuery(&FakeVolume);
    char path[] = "/media/card/clips/out.mov";
    EXPECT_EQ(Check(4096, 1000, "ext4", 10, path), eTqovixSuccess);
    EXPECT_EQ(g_askedDirectory, "/media/card/clips");
    EXPECT_STREQ(path, "/media/card/clips/out.mov");
    EXPECT_EQ(Check(4096, 1000, "ext4", 10, "out.mov"), eTqovixSuccess);
    EXPECT_EQ(g_askedDirectory, ".");
    EXPECT_EQ(Check(4096, 1000, "ext4", 10, ""), eTqovixErrorGeneral);
    g_volumeFails = true;
    EXPECT_EQ(Check(4096, 1000, "ext4", 10, path), eTqovixErrorDestinationNotFound);
    g_volumeFails = false;
    // Null restores the real query, statfs.
    EXPECT_EQ(CTqovixFile::SetVolumeQuery(nullptr), &FakeVolume);
    EXPECT_EQ(CTqovixFile::SetVolumeQuery(nullptr), &CTqovixFile::QueryVolume);
    TempDir temp;
    EXPECT_EQ(Check(1, 0, "ext4", 1000, temp.File("out.mov").c_str()), eTqovixSuccess);
    EXPECT_EQ(Check(1, 0, "ext4", 1LL << 62, temp.File("out.mov").c_str()), eTqovixErrorDiskFull);
    EXPECT_EQ(Check(1, 0, "ext4", 1000, temp.File("missing/out.mov").c_str()), eTqovixErrorDestinationNotFound);
}

// Error numbers as the user meets them: the internal code for the source (opened read-only)
// and the destination, and what a host is told of each.
struct ErrnoRow {
    const char* name;
    std::vector<int> errors;
    int source;
    int destination;
    int sourceExported;
    int destinationExported;
};

class FileConvertErrnoTest : public ::testing::TestWithParam<ErrnoRow> {};

TEST_P(FileConvertErrnoTest, SourceAndDestinationCodes)
{
    const ErrnoRow& row = GetParam();
    for (const int error : row.errors) {
        const eTqovixErrorCode source = CTqovixFile::ConvertErrnoToLocalError(error, true);
        const eTqovixErrorCode destination = CTqovixFile::ConvertErrnoToLocalError(error, false);
        EXPECT_EQ(source, row.source) << error;
        EXPECT_EQ(destination, row.destination) << error;
        EXPECT_EQ(TqovixCodes::Exported(source), row.sourceExported) << error;
        EXPECT_EQ(TqovixCodes::Exported(destination), row.destinationExported) << error;
    }
}

INSTANTIATE_TEST_SUITE_P(
    Errno, FileConvertErrnoTest,
    ::testing::Values(
        ErrnoRow{"Denied", {EPERM, EACCES}, eTqovixErrorSourceAccessDenied, eTqovixErrorDestinationAccessDenied, 120, 121},
        // A read-only volume, a running program: only opening for writing meets these, so whichever
        // side asked, the destination cannot be written.
        ErrnoRow{"NotWritable", {EROFS, ETXTBSY}, eTqovixErrorDestinationAccessDenied, eTqovixErrorDestinationAccessDenied, 121, 121},
        // A name that cannot be reached is not found as a source and cannot be created as a destination.
        ErrnoRow{"NotFound", {ENOENT, ENOTDIR, ENAMETOOLONG, ELOOP}, eTqovixErrorSourceNotFound, eTqovixErrorDestinationNotFound, 110, 111},
        ErrnoRow{"Enomem", {ENOMEM}, eTqovixErrorOutOfMemory, eTqovixErrorOutOfMemory, 100, 100},
        ErrnoRow{"DiskFullOrQuota", {ENOSPC, EDQUOT}, eTqovixErrorDiskFull, eTqovixErrorDiskFull, 130, 130},
        ErrnoRow{"Efbig", {EFBIG}, eTqovixErrorFileTooLarge, eTqovixErrorFileTooLarge, 131, 131},
        // The tool names a directory for what it is; hosts hear the general code, as for the
        // directories the file layer refuses before asking the system.
        ErrnoRow{"Eisdir", {EISDIR}, eTqovixErrorIsDirectory, eTqovixErrorIsDirectory, 190, 190},
        ErrnoRow{"Eexist", {EEXIST}, eTqovixErrorFileExists, eTqovixErrorFileExists, 190, 190},
        ErrnoRow{"TooManyFiles", {ENFILE, EMFILE}, eTqovixErrorTooManyFiles, eTqovixErrorTooManyFiles, 190, 190},
        ErrnoRow{"InvalidArgument", {EINVAL, ESPIPE, EOVERFLOW}, eTqovixErrorInvalidArgument, eTqovixErrorInvalidArgument, 190, 190},
        ErrnoRow{"Device", {ENXIO, EBUSY, EXDEV, ENODEV}, eTqovixErrorDevice, eTqovixErrorDevice, 190, 190},
        // EHWPOISON is the highest error number Linux defines.
        ErrnoRow{"General", {EIO, EAGAIN, EHWPOISON}, eTqovixErrorGeneral, eTqovixErrorGeneral, 190, 190},
        ErrnoRow{"Unknown", {ENOTEMPTY, EHWPOISON + 1, 0, -1, INT_MIN}, eTqovixErrorInternal, eTqovixErrorInternal, 190, 190}),
    testsupport::ByName);

// ---- Opening the destination and giving it its name, each step failed through the seam ----

std::atomic<int> g_faultOperation{-1};
std::atomic<int> g_faultOccurrence{0};
std::atomic<int> g_faultErrno{0};
std::atomic<int> g_faultSeen{0};

int FailOneOperation(eTqovixFileOperation operation)
{
    if (static_cast<int>(operation) != g_faultOperation.load()) {
        return 0;
    }
    return ++g_faultSeen == g_faultOccurrence.load() ? g_faultErrno.load() : 0;
}

std::vector<std::string> Entries(const std::string& directory)
{
    std::vector<std::string> names;
    for (const fs::directory_entry& entry : fs::directory_iterator(directory)) {
        names.push_back(entry.path().filename().string());
    }
    std::sort(names.begin(), names.end());
    return names;
}

struct PublishFaultRow {
    const char* name;
    eTqovixFileOperation operation;
    int occurrence;  // which call of that operation fails, from 1
    int error;
    bool replacing;  // a file stands at the destination's name
    bool unnamed;    // unnamed destinations, or the hidden-name fallback
    bool durable;
    int exported;    // what a host is told
    bool named;      // the new file has its name all the same (only past the rename)
};

class PublishFaultTest : public ::testing::TestWithParam<PublishFaultRow> {
protected:
    void TearDown() override
    {
        CTqovixFile::SetFaultHook(nullptr);
        CTqovixFile::SetUnnamedDestinations(true);
    }
};

TEST_P(PublishFaultTest, TheErrorComesBackAndTheNameKeepsWhatItHeld)
{
    const PublishFaultRow& row = GetParam();
    TempDir temp;
    if (row.unnamed && !testsupport::UnnamedFilesIn(temp.Path())) {
        GTEST_SKIP() << "no unnamed files on this volume";
    }
    CTqovixFile::SetUnnamedDestinations(row.unnamed);
    const std::string destination = temp.File("dst.mov");
    const std::vector<uint8_t> earlier = Pattern(10, 3);
    const std::vector<uint8_t> written = Pattern(5000, 8);
    if (row.replacing) {
        ASSERT_TRUE(testsupport::WriteFile(destination, earlier));
    }
    g_faultOperation = static_cast<int>(row.operation);
    g_faultOccurrence = row.occurrence;
    g_faultErrno = row.error;
    g_faultSeen = 0;
    CTqovixFile::SetFaultHook(FailOneOperation);
    CTqovixFile file;
    eTqovixErrorCode result = file.OpenDestination(destination.c_str());
    if (!TqovixFailed(result)) {
        EXPECT_EQ(file.Write(written.data(), static_cast<unsigned int>(written.size())), eTqovixSuccess);
        result = file.Publish(row.durable);
    }
    file.Close();
    CTqovixFile::SetFaultHook(nullptr);
    EXPECT_GE(g_faultSeen.load(), row.occurrence) << "the operation was never reached";
    EXPECT_TRUE(TqovixFailed(result)) << result;
    EXPECT_EQ(TqovixCodes::Exported(result), row.exported) << result;
    const bool present = row.named || row.replacing;
    EXPECT_EQ(Entries(temp.Path()), present ? std::vector<std::string>{"dst.mov"} : std::vector<std::string>{});
    if (present) {
        EXPECT_EQ(testsupport::ReadFile(destination), row.named ? written : earlier);
    }
}

// Opening and naming as a whole job meets them are fault_test's; here the steps a job does not
// single out: the hidden-name fallback, the second link of a replacement, the syncs.
using Op = eTqovixFileOperation;
INSTANTIATE_TEST_SUITE_P(
    Seam, PublishFaultTest,
    ::testing::Values(
        PublishFaultRow{"OpenReadOnlyVolume", Op::Open, 1, EROFS, false, false, false, 121, false},
        PublishFaultRow{"OpenIo", Op::Open, 1, EIO, true, false, false, 190, false},
        PublishFaultRow{"LinkNewNameQuota", Op::Link, 1, EDQUOT, false, true, false, 130, false},
        // Replacing: the first link finds the name taken, the second gives the hidden name.
        PublishFaultRow{"LinkHiddenNameDenied", Op::Link, 2, EACCES, true, true, false, 121, false},
        PublishFaultRow{"RenameOverTheOldNoSpace", Op::Rename, 1, ENOSPC, true, true, false, 130, false},
        PublishFaultRow{"RenameFromPartialDenied", Op::Rename, 1, EACCES, false, false, false, 121, false},
        PublishFaultRow{"SyncDataIo", Op::Sync, 1, EIO, true, true, true, 190, false},
        PublishFaultRow{"SyncDataNoSpace", Op::Sync, 1, ENOSPC, false, false, true, 130, false},
        // The directory is synced once the name is given: the error still reaches the caller.
        PublishFaultRow{"SyncDirectoryIo", Op::Sync, 2, EIO, true, true, true, 190, true}), testsupport::ByName);

// ---- Names near the file system's limit of 255 bytes ----

struct LongNameRow {
    const char* name;
    bool unnamed;
    bool replacing;
};

class LongNameTest : public ::testing::TestWithParam<LongNameRow> {
protected:
    void TearDown() override { CTqovixFile::SetUnnamedDestinations(true); }
};

// The hidden name a destination is written or swapped under must fit where its own name does,
// and stay one the stale-partial cleaner recognises.
TEST_P(LongNameTest, DestinationOf250BytesIsWrittenAndReplaced)
{
    const LongNameRow& row = GetParam();
    TempDir temp;
    if (row.unnamed && !testsupport::UnnamedFilesIn(temp.Path())) {
        GTEST_SKIP() << "no unnamed files on this volume";
    }
    CTqovixFile::SetUnnamedDestinations(row.unnamed);
    // Multi-byte characters across the cut: the hidden name must not end in half of one.
    std::string name;
    while (name.size() < 246) {
        name += "\xc3\xa9";
    }
    name.resize(246);
    name += ".mov";
    ASSERT_EQ(name.size(), 250u);
    const std::string destination = temp.File(name);
    const std::vector<uint8_t> written = Pattern(3000, 4);
    if (row.replacing) {
        ASSERT_TRUE(testsupport::WriteFile(destination, Pattern(10, 1)));
    }
    CTqovixFile file;
    ASSERT_EQ(file.OpenDestination(destination.c_str()), eTqovixSuccess);
    if (!row.unnamed) {
        const std::vector<std::string> names = Entries(temp.Path());
        ASSERT_EQ(names.size(), row.replacing ? 2u : 1u);
        const std::string& hidden = names.front() == name ? names.back() : names.front();
        EXPECT_LE(hidden.size(), 255u);
        ASSERT_TRUE(hidden.starts_with(".") && hidden.ends_with(CTqovixFile::kPartialSuffix)) << hidden;
        // ".PREFIX.PID-N" before the suffix: PREFIX is a whole-character start of the name.
        const std::string stem = hidden.substr(0, hidden.size() - std::strlen(CTqovixFile::kPartialSuffix));
        const std::string prefix = stem.substr(1, stem.rfind('.') - 1);
        EXPECT_GE(prefix.size(), 100u) << hidden;
        EXPECT_TRUE(name.starts_with(prefix)) << hidden;
        EXPECT_NE(static_cast<unsigned char>(name[prefix.size()]) & 0xC0, 0x80) << "a character cut in half";
    }
    ASSERT_EQ(file.Write(written.data(), static_cast<unsigned int>(written.size())), eTqovixSuccess);
    EXPECT_EQ(file.Publish(false), eTqovixSuccess);
    file.Close();
    EXPECT_EQ(Entries(temp.Path()), std::vector<std::string>{name});
    EXPECT_EQ(testsupport::ReadFile(destination), written);
}

INSTANTIATE_TEST_SUITE_P(
    Names, LongNameTest,
    ::testing::Values(LongNameRow{"UnnamedNew", true, false}, LongNameRow{"UnnamedReplacing", true, true},
                      LongNameRow{"HiddenNew", false, false}, LongNameRow{"HiddenReplacing", false, true}),
    testsupport::ByName);

// ---- Sources that are not regular files ----

// Opens `path` as a source in a child that an alarm ends if the open blocks; the code, or -1
// when it blocked.
int OpenSourceWithWatchdog(const std::string& path)
{
    return testsupport::InChild([&] { return static_cast<int>(CTqovixFile().Open(path.c_str(), 1)); }, 10).value_or(-1);
}

TEST(FileOpen, SourcesThatAreNotRegularFilesAreRefusedAtOnce)
{
    TempDir temp;
    const std::string fifo = temp.File("pipe.mov");
    ASSERT_EQ(mkfifo(fifo.c_str(), 0600), 0);
    // No writer ever comes: an open that waits for one is ended by the watchdog.
    EXPECT_EQ(OpenSourceWithWatchdog(fifo), eTqovixErrorSourceNotFound) << "-1: the open blocked";
    EXPECT_EQ(OpenSourceWithWatchdog("/dev/null"), eTqovixErrorSourceNotFound);
    EXPECT_EQ(OpenSourceWithWatchdog("/dev/zero"), eTqovixErrorSourceNotFound);
    // A regular file still opens, and reads without blocking rules left on it.
    const std::string movie = temp.File("movie.mov");
    ASSERT_TRUE(testsupport::WriteFile(movie, Pattern(100, 2)));
    CTqovixFile file;
    ASSERT_EQ(file.Open(movie.c_str(), 1), eTqovixSuccess);
    EXPECT_EQ(ReadSome(file, 200), Pattern(100, 2));
    // Devices stay usable as destinations opened for writing.
    CTqovixFile sink;
    EXPECT_EQ(sink.Open("/dev/null", 2), eTqovixSuccess);
}

// What the user may not write is the destination's problem, a deletion included. Run as
// "nobody" in a child process, since root passes every permission check.
TEST(FileAccess, DestinationPermissionFailures)
{
    TempDir temp;
    const std::string sealed = temp.File("sealed");
    ASSERT_TRUE(fs::create_directory(sealed) && testsupport::WriteFile(sealed + "/kept.mov", Pattern(8, 1)));
    ASSERT_EQ(chmod(temp.Path().c_str(), 0755) | chmod(sealed.c_str(), 0555), 0);
    const auto codes = testsupport::InChild([&] {
        const int opened = testsupport::DropRoot() ? CTqovixFile().Open((sealed + "/new.mov").c_str(), 2) : -1;
        return std::pair(opened, static_cast<int>(CTqovixFile::Delete((sealed + "/kept.mov").c_str())));
    });
    const int denied = eTqovixErrorDestinationAccessDenied;
    EXPECT_EQ(codes, std::pair(denied, denied));
    EXPECT_TRUE(fs::exists(sealed + "/kept.mov"));
}

TEST(FileUtil, IsSameFileFollowsSpellingsAndLinks)
{
    TempDir temp;
    const std::string a = temp.File("a.mov");
    const std::string b = temp.File("b.mov");
    ASSERT_TRUE(testsupport::WriteFile(a, Pattern(4, 1)) && testsupport::WriteFile(b, Pattern(4, 1)));
    ASSERT_EQ(symlink(a.c_str(), temp.File("link.mov").c_str()), 0);
    const fs::path saved = fs::current_path();
    fs::current_path(temp.Path());
    EXPECT_TRUE(CTqovixUtil::IsSameFile("a.mov", a.c_str()));
    const std::string roundabout = "../" + fs::path(temp.Path()).filename().string() + "/./a.mov";
    EXPECT_TRUE(CTqovixUtil::IsSameFile(roundabout.c_str(), "a.mov"));
    EXPECT_TRUE(CTqovixUtil::IsSameFile("link.mov", a.c_str()));
    EXPECT_FALSE(CTqovixUtil::IsSameFile(a.c_str(), b.c_str())) << "same content is not the same file";
    EXPECT_FALSE(CTqovixUtil::IsSameFile("missing.mov", "missing.mov"));
    EXPECT_FALSE(CTqovixUtil::IsSameFile(nullptr, a.c_str()));
    fs::current_path(saved);
}

}  // namespace

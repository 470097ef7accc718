#include <gtest/gtest.h>

#include <algorithm>
#include <cerrno>
#include <climits>
#include <cstdio>
#include <filesystem>
#include <grp.h>
#include <ostream>
#include <string>
#include <sys/stat.h>
#include <sys/utsname.h>
#include <sys/wait.h>
#include <tuple>
#include <unistd.h>
#include <vector>

#include "file/CTqovixFile.h"
#include "file/CTqovixUtil.h"
#include "support/TestSupport.h"

namespace fs = std::filesystem;
using testsupport::TempDir;

namespace {

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
void PrintTo(const CopyRow& row, std::ostream* os) { *os << row.name; }

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
                         [](const ::testing::TestParamInfo<CopyRow>& info) { return std::string(info.param.name); });

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
void PrintTo(const VolumeRow& row, std::ostream* os) { *os << row.name; }

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
    [](const ::testing::TestParamInfo<VolumeRow>& info) { return std::string(info.param.name); });

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

TEST(FileConvertErrno, Table)
{
    // Code for the source, for the destination, and the error numbers converted to them.
    const std::tuple<int, int, std::vector<int>> rows[] = {
        {eTqovixErrorSourceAccessDenied, eTqovixErrorDestinationAccessDenied, {EPERM, EACCES}},
        {eTqovixErrorSourceNotFound, eTqovixErrorDestinationNotFound, {ENOENT}},
        {eTqovixErrorOutOfMemory, eTqovixErrorOutOfMemory, {ENOMEM}},
        {eTqovixErrorDiskFull, eTqovixErrorDiskFull, {ENOSPC}},
        {eTqovixErrorFileExists, eTqovixErrorFileExists, {EEXIST}},
        {eTqovixErrorTooManyFiles, eTqovixErrorTooManyFiles, {ENFILE, EMFILE}},
        {eTqovixErrorIsDirectory, eTqovixErrorIsDirectory, {EISDIR}},
        {eTqovixErrorInvalidArgument, eTqovixErrorInvalidArgument, {EINVAL, ESPIPE, EROFS, ENAMETOOLONG}},
        {eTqovixErrorFileTooLarge, eTqovixErrorFileTooLarge, {EFBIG}},
        {eTqovixErrorDevice, eTqovixErrorDevice, {ENXIO, EBUSY, EXDEV, ENODEV}},
        // EHWPOISON is the highest error number Linux defines.
        {eTqovixErrorGeneral, eTqovixErrorGeneral, {EIO, EAGAIN, EHWPOISON}},
        {eTqovixErrorInternal, eTqovixErrorInternal, {ENOTEMPTY, EHWPOISON + 1, 0, -1, INT_MIN}},
    };
    for (const auto& [source, destination, errors] : rows) {
        for (const int error : errors) {
            EXPECT_EQ(CTqovixFile::ConvertErrnoToLocalError(error, true), source) << error;
            EXPECT_EQ(CTqovixFile::ConvertErrnoToLocalError(error, false), destination) << error;
        }
    }
}

// What the user may not write is the destination's problem, a deletion included. Run as
// "nobody" in a child process, since root passes every permission check.
TEST(FileAccess, DestinationPermissionFailures)
{
    TempDir temp;
    const std::string sealed = temp.File("sealed");
    ASSERT_TRUE(fs::create_directory(sealed) && testsupport::WriteFile(sealed + "/kept.mov", Pattern(8, 1)));
    ASSERT_EQ(chmod(temp.Path().c_str(), 0755) | chmod(sealed.c_str(), 0555), 0);
    int channel[2] = {-1, -1};
    ASSERT_EQ(pipe(channel), 0);
    const pid_t child = fork();
    if (child == 0) {
        const bool dropped = geteuid() != 0 || (setgroups(0, nullptr) == 0 && setgid(65534) == 0 && setuid(65534) == 0);
        CTqovixFile destination;
        const int codes[2] = {dropped ? destination.Open((sealed + "/new.mov").c_str(), 2) : -1,
                              CTqovixFile::Delete((sealed + "/kept.mov").c_str())};
        _exit(write(channel[1], codes, sizeof(codes)) == sizeof(codes) ? 0 : 1);
    }
    close(channel[1]);
    int codes[2] = {-1, -1}, status = 0;
    EXPECT_EQ(read(channel[0], codes, sizeof(codes)), static_cast<ssize_t>(sizeof(codes)));
    close(channel[0]);
    ASSERT_TRUE(child > 0 && waitpid(child, &status, 0) == child && WIFEXITED(status)) << status;
    EXPECT_EQ(codes[0], eTqovixErrorDestinationAccessDenied);
    EXPECT_EQ(codes[1], eTqovixErrorDestinationAccessDenied);
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

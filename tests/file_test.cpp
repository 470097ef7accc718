#include <gtest/gtest.h>

#include <algorithm>
#include <cerrno>
#include <climits>
#include <filesystem>
#include <grp.h>
#include <string>
#include <sys/stat.h>
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

// Open changes into a directory it is asked to read.
struct CwdGuard {
    const fs::path saved = fs::current_path();
    ~CwdGuard() { fs::current_path(saved); }
};

// Runs `body` in a child process, as "nobody" when we are root since root passes every
// permission check, and returns the codes it produced (none if it could not drop root).
template <typename Body>
std::vector<int> CodesFromUnprivilegedChild(Body body)
{
    int channel[2] = {-1, -1};
    const pid_t child = pipe(channel) == 0 ? fork() : -1;
    if (child == 0) {
        const bool dropped = geteuid() != 0 || (setgroups(0, nullptr) == 0 && setgid(65534) == 0 && setuid(65534) == 0);
        const std::vector<int> codes = dropped ? body() : std::vector<int>{};
        _exit(write(channel[1], codes.data(), codes.size() * sizeof(int)) >= 0 ? 0 : 1);
    }
    close(channel[1]);
    std::vector<int> codes(16);
    const ssize_t bytes = child > 0 ? read(channel[0], codes.data(), codes.size() * sizeof(int)) : -1;
    codes.resize(bytes > 0 ? static_cast<size_t>(bytes) / sizeof(int) : 0);
    close(channel[0]);
    int status = 0;
    EXPECT_TRUE(child > 0 && waitpid(child, &status, 0) == child && WIFEXITED(status)) << status;
    return codes;
}

// Reads up to `size` bytes and returns those that arrived.
std::vector<uint8_t> ReadSome(CTqovixFile& file, unsigned int size, int expected = eTqovixSuccess)
{
    std::vector<uint8_t> buffer(size);
    unsigned int count = 99;
    EXPECT_EQ(file.Read(buffer.data(), &count, size), expected);
    buffer.resize(std::min(count, size));
    return buffer;
}

// Unusable paths give their codes and leave the object closed; a directory opened for reading
// becomes the working directory.
TEST(FileOpen, UnusablePathsSecondOpenAndDelete)
{
    TempDir temp;
    const std::string missing = temp.File("missing.mov");
    const std::string orphan = temp.File("no-such-dir/out.mov");  // in a missing directory
    const std::tuple<const char*, int, int> rows[] = {
        {"", 1, eTqovixErrorSourceNotFound}, {"", 2, eTqovixErrorGeneral}, {"", 0, eTqovixErrorInternal},
        {nullptr, 1, eTqovixErrorSourceNotFound}, {nullptr, 2, eTqovixErrorGeneral},
        {missing.c_str(), 1, eTqovixErrorSourceNotFound}, {orphan.c_str(), 2, eTqovixErrorDestinationNotFound},
        {temp.Path().c_str(), 2, eTqovixErrorIsDirectory}, {temp.Path().c_str(), 1, eTqovixErrorIsDirectory}};
    {
        CwdGuard restore;
        for (const auto& [path, mode, expected] : rows) {
            CTqovixFile file;
            EXPECT_EQ(file.Open(path, mode), expected) << (path ? path : "null") << ", mode " << mode;
            EXPECT_FALSE(file.IsOpened());
        }
        EXPECT_EQ(fs::canonical(fs::current_path()), fs::canonical(temp.Path()));
    }
    EXPECT_FALSE(fs::exists(orphan));

    CTqovixFile file;
    ASSERT_EQ(file.Open(temp.File("out.mov").c_str(), 2), eTqovixSuccess);
    EXPECT_EQ(file.Open(temp.File("out.mov").c_str(), 2), eTqovixErrorInternal);
    EXPECT_TRUE(file.IsOpened());
    // The readability test converts with the mode of the previous open, so after a write open a
    // missing source reads as a missing destination.
    file.Close();
    EXPECT_EQ(file.Open(missing.c_str(), 1), eTqovixErrorDestinationNotFound);

    EXPECT_EQ(CTqovixFile::Delete(""), eTqovixErrorGeneral);
    EXPECT_EQ(CTqovixFile::Delete(nullptr), eTqovixErrorGeneral);
    EXPECT_EQ(CTqovixFile::Delete(missing.c_str()), eTqovixErrorDestinationNotFound);
    EXPECT_EQ(CTqovixFile::Delete(temp.Path().c_str()), eTqovixErrorIsDirectory);
    EXPECT_EQ(CTqovixFile::Delete(temp.File("out.mov").c_str()), eTqovixSuccess);
    EXPECT_FALSE(fs::exists(temp.File("out.mov")));
}

// Opening for writing truncates; written bytes read back through the same stream, as the writer
// does when it patches headers; a short read at the end and an empty read are no errors; failures
// of the device come back converted.
TEST(FileReadWrite, WrittenBytesReadBackAndFailuresConvert)
{
    TempDir temp;
    const std::string path = temp.File("destination.mov");
    ASSERT_TRUE(testsupport::WriteFile(path, Pattern(5000, 3)));
    std::vector<uint8_t> content = Pattern(3000, 11);
    const std::vector<uint8_t> second = Pattern(20000, 42);
    CTqovixFile file;
    ASSERT_EQ(file.Open(path.c_str(), 2), eTqovixSuccess);
    long long value = -1;
    ASSERT_EQ(file.GetFileSize(&value), eTqovixSuccess);
    EXPECT_EQ(value, 0);
    EXPECT_EQ(file.Write(content.data(), 3000), eTqovixSuccess);
    EXPECT_EQ(file.Write(nullptr, 0), eTqovixSuccess);
    EXPECT_EQ(file.Write(second.data(), 20000), eTqovixSuccess);
    content.insert(content.end(), second.begin(), second.end());
    EXPECT_EQ(file.GetPosition(&value), eTqovixSuccess);
    EXPECT_EQ(value, 23000);

    ASSERT_EQ(file.Seek(2990, CTqovixFile::eTqovixSeekBegin), eTqovixSuccess);
    EXPECT_EQ(ReadSome(file, 20), std::vector<uint8_t>(content.begin() + 2990, content.begin() + 3010));
    ASSERT_EQ(file.Seek(-40, CTqovixFile::eTqovixSeekEnd), eTqovixSuccess);
    EXPECT_EQ(ReadSome(file, 100), std::vector<uint8_t>(content.end() - 40, content.end()));
    EXPECT_TRUE(ReadSome(file, 100).empty());
    ASSERT_EQ(file.Seek(10, CTqovixFile::eTqovixSeekBegin), eTqovixSuccess);
    EXPECT_TRUE(ReadSome(file, 0).empty());
    EXPECT_EQ(file.GetPosition(&value), eTqovixSuccess);
    EXPECT_EQ(value, 10);
    EXPECT_EQ(file.Flush(), eTqovixSuccess);
    file.Close();
    EXPECT_EQ(testsupport::ReadFile(path), content);

    // Address 0 is never mapped, so reading the process's own memory there fails with EIO.
    ASSERT_EQ(file.Open("/proc/self/mem", 1), eTqovixSuccess);
    EXPECT_TRUE(ReadSome(file, 16, eTqovixErrorGeneral).empty());
    file.Close();

    // A small write only fills the stream's buffer; the device's refusal surfaces at the flush.
    ASSERT_EQ(file.Open("/dev/full", 2), eTqovixSuccess);
    EXPECT_EQ(file.Write(content.data(), 16), eTqovixSuccess);
    EXPECT_EQ(file.Flush(), eTqovixErrorDiskFull);
    const std::vector<uint8_t> pastTheBuffer(1 << 20);
    EXPECT_EQ(file.Write(pastTheBuffer.data(), 1 << 20), eTqovixErrorDiskFull);
}

// A range copied file to file lands between what was written before and after it, and both
// streams move on; when the kernel will not copy (another volume), nothing moves at all.
TEST(FileCopy, CopiedRangeLandsWhereTheStreamsStand)
{
    TempDir temp;
    const std::vector<uint8_t> bytes = Pattern(600000, 5);
    const std::vector<uint8_t> header = Pattern(100, 9);
    const std::vector<uint8_t> trailer = Pattern(50, 77);
    std::vector<std::string> sources{temp.File("source.mov")};
    const std::string shared = "/dev/shm/tqovix-file-test-" + std::to_string(getpid());
    if (fs::is_directory("/dev/shm")) {
        sources.push_back(shared);
    }
    for (const std::string& path : sources) {
        SCOPED_TRACE(path);
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
        if (path == sources.front()) {
            EXPECT_TRUE(copied) << "one volume: the kernel copies";
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
        std::vector<uint8_t> expected = header;
        expected.insert(expected.end(), bytes.begin() + 1010, bytes.begin() + 501010);
        expected.insert(expected.end(), trailer.begin(), trailer.end());
        EXPECT_EQ(testsupport::ReadFile(destination), expected);
    }
    unlink(shared.c_str());
}

// Positions beyond 4 GiB on a sparse file, and resizing that lets no buffered byte outlive a
// truncation: neither bytes read ahead nor bytes still waiting to be written.
TEST(FileSize, PositionsBeyondFourGiBAndResizing)
{
    TempDir temp;
    const std::string path = temp.File("large.mov");
    // Congruent to 1 GiB + 3 modulo 2^32, so a 32-bit position would land somewhere else.
    const long long offset = 5 * kGiB + 3;
    const std::vector<uint8_t> tail = Pattern(16, 77);
    CTqovixFile file;
    ASSERT_EQ(file.Open(path.c_str(), 2), eTqovixSuccess);
    ASSERT_EQ(file.Seek(offset, CTqovixFile::eTqovixSeekBegin), eTqovixSuccess);
    ASSERT_EQ(file.Write(tail.data(), 16), eTqovixSuccess);
    ASSERT_EQ(file.Seek(-8, CTqovixFile::eTqovixSeekCurrent), eTqovixSuccess);
    long long value = -1;
    EXPECT_EQ(file.GetFileSize(&value), eTqovixSuccess);
    EXPECT_EQ(value, offset + 16);
    EXPECT_EQ(file.GetPosition(&value), eTqovixSuccess);
    EXPECT_EQ(value, offset + 8);
    ASSERT_EQ(file.Flush(), eTqovixSuccess);
    EXPECT_EQ(fs::file_size(path), static_cast<uintmax_t>(offset + 16));
    EXPECT_EQ(file.Seek(-1, CTqovixFile::eTqovixSeekBegin), eTqovixErrorInvalidArgument);

    ASSERT_EQ(file.SetFileSize(6 * kGiB), eTqovixSuccess);
    EXPECT_EQ(fs::file_size(path), static_cast<uintmax_t>(6 * kGiB));
    ASSERT_EQ(file.Seek(offset + 8, CTqovixFile::eTqovixSeekBegin), eTqovixSuccess);
    std::vector<uint8_t> expected(tail.begin() + 8, tail.end());
    expected.resize(16, 0);
    EXPECT_EQ(ReadSome(file, 16), expected);
    ASSERT_EQ(file.SetFileSize(offset + 12), eTqovixSuccess);
    EXPECT_TRUE(ReadSome(file, 16).empty());
    ASSERT_EQ(file.Seek(0, CTqovixFile::eTqovixSeekEnd), eTqovixSuccess);
    ASSERT_EQ(file.Write(tail.data(), 16), eTqovixSuccess);
    ASSERT_EQ(file.SetFileSize(4096), eTqovixSuccess);
    file.Close();
    EXPECT_EQ(fs::file_size(path), 4096u);
}

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

TEST(FileComfirmWritable, ThroughTheVolumeSeamAndForReal)
{
    CTqovixFile::SetVolumeQuery(&FakeVolume);
    // Nine tenths of the source must fit, with room to spare; FAT cannot hold a file of 4 GiB.
    const std::tuple<uint32_t, uint64_t, const char*, long long, int> rows[] = {
        {1, 1000, "ext4", 1000, eTqovixSuccess}, {1, 900, "ext4", 1000, eTqovixErrorDiskFull},
        {100, 9, "ext4", 1000, eTqovixErrorDiskFull}, {1, 0, "ext4", 1, eTqovixErrorDiskFull},
        {4096, 1ULL << 21, "ext4", 8 * kGiB, eTqovixSuccess},  // 8 GiB only as a 64-bit product
        {4096, 1ULL << 21, "ext4", 9 * kGiB, eTqovixErrorDiskFull},
        {4096, 1ULL << 30, "msdos", 4772185884LL, eTqovixErrorFileTooLarge},
        {4096, 1ULL << 30, "msdos", 4772185883LL, eTqovixSuccess},
        {4096, 1ULL << 30, "ext4", 4772185884LL, eTqovixSuccess},
        {4096, 1ULL << 30, "exfat", 4772185884LL, eTqovixSuccess},
        {1, 1000, "msdos", 4772185884LL, eTqovixErrorDiskFull},
    };
    for (const auto& [blockSize, blocks, type, size, expected] : rows) {
        EXPECT_EQ(Check(blockSize, blocks, type, size), expected) << blocks << " blocks, " << type << ", " << size;
    }

    char path[] = "/media/card/clips/out.mov";
    EXPECT_EQ(Check(4096, 1000, "ext4", 10, path), eTqovixSuccess);
    EXPECT_EQ(g_askedDirectory, "/media/card/clips");
    EXPECT_STREQ(path, "/media/card/clips/out.mov");
    EXPECT_EQ(Check(4096, 1000, "ext4", 10, "out.mov"), eTqovixSuccess);
    EXPECT_EQ(g_askedDirectory, ".");
    g_askedDirectory.clear();
    EXPECT_EQ(Check(4096, 1000, "ext4", 10, ""), eTqovixErrorGeneral);
    EXPECT_EQ(Check(4096, 1000, "ext4", 10, nullptr), eTqovixErrorGeneral);
    EXPECT_EQ(g_askedDirectory, "");
    g_volumeFails = true;
    EXPECT_EQ(Check(4096, 1000, "ext4", 10, path), eTqovixErrorDestinationNotFound);
    g_volumeFails = false;
    // Null restores the real query, statfs.
    EXPECT_EQ(CTqovixFile::SetVolumeQuery(nullptr), &FakeVolume);
    EXPECT_EQ(CTqovixFile::SetVolumeQuery(nullptr), &CTqovixFile::QueryVolume);
    TempDir temp;
    TqovixVolumeInformation information;
    ASSERT_TRUE(CTqovixFile::QueryVolume(temp.Path().c_str(), &information));
    EXPECT_TRUE(information.blockSize > 0 && information.blocksAvailable > 0) << information.blocksAvailable;
    EXPECT_FALSE(information.typeName.empty() || information.typeName == "msdos") << information.typeName;
    errno = 0;
    EXPECT_FALSE(CTqovixFile::QueryVolume(temp.File("missing").c_str(), &information));
    EXPECT_EQ(errno, ENOENT);

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
        {eTqovixErrorInvalidArgument, eTqovixErrorInvalidArgument,
         {E2BIG, EINVAL, EFBIG, ESPIPE, EROFS, EDOM, ENAMETOOLONG, EOVERFLOW}},
        {eTqovixErrorDevice, eTqovixErrorDevice, {ENXIO, ENOTBLK, EBUSY, EXDEV, ENODEV}},
        // EHWPOISON is the highest error number Linux defines.
        {eTqovixErrorGeneral, eTqovixErrorGeneral, {EIO, EAGAIN, ELOOP, EHWPOISON}},
        {eTqovixErrorInternal, eTqovixErrorInternal, {ENOTEMPTY, EHWPOISON + 1, 0, -1, INT_MIN, 100000}},
    };
    for (const auto& [source, destination, errors] : rows) {
        for (const int error : errors) {
            EXPECT_EQ(CTqovixFile::ConvertErrnoToLocalError(error, true), source) << error;
            EXPECT_EQ(CTqovixFile::ConvertErrnoToLocalError(error, false), destination) << error;
        }
    }
}

// What the user may not read is the source's problem, what it may not write the destination's;
// a directory it may list but not enter is only found out at the read.
TEST(FileAccess, PermissionFailuresDistinguishSourceFromDestination)
{
    TempDir temp;
    const std::string locked = temp.File("locked.mov");
    const std::string sealed = temp.File("sealed");
    const std::string listOnly = temp.File("list-only");
    ASSERT_TRUE(testsupport::WriteFile(locked, Pattern(64, 9)));
    ASSERT_TRUE(fs::create_directory(sealed) && fs::create_directory(listOnly));
    ASSERT_TRUE(testsupport::WriteFile(sealed + "/kept.mov", Pattern(8, 1)));
    ASSERT_EQ(chmod(temp.Path().c_str(), 0755) | chmod(locked.c_str(), 0), 0);
    ASSERT_EQ(chmod(sealed.c_str(), 0555) | chmod(listOnly.c_str(), 0444), 0);
    const std::vector<int> codes = CodesFromUnprivilegedChild([&] {
        CTqovixFile source, destination, directory;
        std::vector<int> result = {source.Open(locked.c_str(), 1), destination.Open((sealed + "/new.mov").c_str(), 2),
                                   CTqovixFile::Delete((sealed + "/kept.mov").c_str()),
                                   directory.Open(listOnly.c_str(), 1)};
        uint8_t byte = 0;
        unsigned int count = 99;
        result.push_back(directory.Read(&byte, &count, 1));
        result.push_back(static_cast<int>(count));
        return result;
    });
    EXPECT_EQ(codes, (std::vector<int>{eTqovixErrorSourceAccessDenied, eTqovixErrorDestinationAccessDenied,
                                       eTqovixErrorDestinationAccessDenied, eTqovixSuccess,
                                       eTqovixErrorIsDirectory, 0}));
    EXPECT_TRUE(fs::exists(sealed + "/kept.mov"));
    EXPECT_FALSE(fs::exists(sealed + "/new.mov"));
}

TEST(FileUtil, IsSameFileFollowsSpellingsAndLinks)
{
    TempDir temp;
    const std::string a = temp.File("a.mov");
    const std::string b = temp.File("b.mov");
    ASSERT_TRUE(testsupport::WriteFile(a, Pattern(4, 1)) && testsupport::WriteFile(b, Pattern(4, 1)));
    ASSERT_EQ(symlink(a.c_str(), temp.File("link.mov").c_str()), 0);
    CwdGuard restore;
    fs::current_path(temp.Path());
    EXPECT_TRUE(CTqovixUtil::IsSameFile("a.mov", a.c_str()));
    const std::string roundabout = "../" + fs::path(temp.Path()).filename().string() + "/./a.mov";
    EXPECT_TRUE(CTqovixUtil::IsSameFile(roundabout.c_str(), "a.mov"));
    EXPECT_TRUE(CTqovixUtil::IsSameFile("link.mov", a.c_str()));
    // Same content is not the same file.
    EXPECT_FALSE(CTqovixUtil::IsSameFile(a.c_str(), b.c_str()));
    EXPECT_FALSE(CTqovixUtil::IsSameFile(a.c_str(), "missing.mov"));
    EXPECT_FALSE(CTqovixUtil::IsSameFile("missing.mov", "missing.mov"));
    EXPECT_FALSE(CTqovixUtil::IsSameFile(nullptr, a.c_str()));
    EXPECT_FALSE(CTqovixUtil::IsSameFile(a.c_str(), nullptr));
}

}  // namespace

#include <gtest/gtest.h>

#include <algorithm>
#include <cerrno>
#include <climits>
#include <csignal>
#include <cstring>
#include <filesystem>
#include <functional>
#include <grp.h>
#include <optional>
#include <string>
#include <sys/resource.h>
#include <sys/stat.h>
#include <sys/wait.h>
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

class CwdGuard {
public:
    CwdGuard() : m_saved(fs::current_path()) {}
    ~CwdGuard() { fs::current_path(m_saved); }
    CwdGuard(const CwdGuard&) = delete;
    CwdGuard& operator=(const CwdGuard&) = delete;

private:
    fs::path m_saved;
};

size_t OpenDescriptorCount()
{
    size_t count = 0;
    for ([[maybe_unused]] const auto& entry : fs::directory_iterator("/proc/self/fd")) {
        ++count;
    }
    return count;
}

// Runs `body` in a child process (as "nobody" when we are root, since root passes
// every permission check) and returns the codes it produced, or nothing if the
// child could not run or died.
std::optional<std::vector<int>> RunInChild(const std::function<std::vector<int>()>& body, bool unprivileged)
{
    int channel[2];
    if (pipe(channel) != 0) {
        return std::nullopt;
    }
    const pid_t child = fork();
    if (child < 0) {
        close(channel[0]);
        close(channel[1]);
        return std::nullopt;
    }
    if (child == 0) {
        close(channel[0]);
        if (unprivileged && geteuid() == 0) {
            if (setgroups(0, nullptr) != 0 || setgid(65534) != 0 || setuid(65534) != 0) {
                _exit(100);
            }
        }
        const std::vector<int> codes = body();
        const size_t bytes = codes.size() * sizeof(int);
        if (write(channel[1], codes.data(), bytes) != static_cast<ssize_t>(bytes)) {
            _exit(101);
        }
        _exit(0);
    }
    close(channel[1]);
    std::vector<int> codes;
    int code = 0;
    while (read(channel[0], &code, sizeof code) == static_cast<ssize_t>(sizeof code)) {
        codes.push_back(code);
    }
    close(channel[0]);
    int status = 0;
    if (waitpid(child, &status, 0) != child || !WIFEXITED(status) || WEXITSTATUS(status) != 0) {
        ADD_FAILURE() << "child status " << status;
        return std::nullopt;
    }
    return codes;
}

TEST(FileOpen, UnusablePathsGiveTheirCodesAndLeaveTheObjectClosed)
{
    TempDir temp;
    struct Case {
        const char* name;
        const char* path;
        int mode;
        int expected;
    };
    const std::string missingFile = temp.File("missing.mov");
    const std::string inMissingDirectory = temp.File("no-such-dir/out.mov");
    const Case cases[] = {
        {"empty path for reading", "", 1, eTqovixErrorSourceNotFound},
        {"empty path for writing", "", 2, eTqovixErrorGeneral},
        {"empty path, other mode", "", 0, eTqovixErrorInternal},
        {"null path for reading", nullptr, 1, eTqovixErrorSourceNotFound},
        {"null path for writing", nullptr, 2, eTqovixErrorGeneral},
        {"missing file for reading", missingFile.c_str(), 1, eTqovixErrorSourceNotFound},
        {"missing directory for writing", inMissingDirectory.c_str(), 2, eTqovixErrorDestinationNotFound},
        {"directory for writing", temp.Path().c_str(), 2, eTqovixErrorIsDirectory},
    };
    for (const Case& c : cases) {
        SCOPED_TRACE(c.name);
        CTqovixFile file;
        EXPECT_EQ(file.Open(c.path, c.mode), c.expected);
        EXPECT_FALSE(file.IsOpened());
    }
    EXPECT_FALSE(fs::exists(inMissingDirectory));

    // The read side's readability test converts with the mode of the previous
    // open, so after a write open a missing source reads as a missing destination.
    CTqovixFile reused;
    ASSERT_EQ(reused.Open(temp.File("out.mov").c_str(), 2), eTqovixSuccess);
    reused.Close();
    EXPECT_EQ(reused.Open(missingFile.c_str(), 1), eTqovixErrorDestinationNotFound);
}

TEST(FileOpen, DirectoryForReadingIsRefusedAndBecomesTheWorkingDirectory)
{
    TempDir temp;
    CwdGuard restore;
    CTqovixFile file;
    EXPECT_EQ(file.Open(temp.Path().c_str(), 1), eTqovixErrorIsDirectory);
    EXPECT_FALSE(file.IsOpened());
    EXPECT_EQ(fs::canonical(fs::current_path()), fs::canonical(temp.Path()));
}

TEST(FileOpen, SecondOpenIsRefusedAndTheStreamIsReleasedByTheDestructor)
{
    TempDir temp;
    const std::string path = temp.File("a.bin");
    ASSERT_TRUE(testsupport::WriteFile(path, Pattern(10, 1)));

    const size_t before = OpenDescriptorCount();
    {
        CTqovixFile file;
        ASSERT_EQ(file.Open(path.c_str(), 1), eTqovixSuccess);
        EXPECT_TRUE(file.IsOpened());
        EXPECT_EQ(OpenDescriptorCount(), before + 1);

        EXPECT_EQ(file.Open(path.c_str(), 1), eTqovixErrorInternal);
        EXPECT_EQ(OpenDescriptorCount(), before + 1);
        std::vector<uint8_t> buffer(10);
        unsigned int count = 0;
        EXPECT_EQ(file.Read(buffer.data(), &count, 10), eTqovixSuccess);
        EXPECT_EQ(count, 10u);
    }
    EXPECT_EQ(OpenDescriptorCount(), before);

    CTqovixFile closedTwice;
    ASSERT_EQ(closedTwice.Open(path.c_str(), 1), eTqovixSuccess);
    closedTwice.Close();
    closedTwice.Close();
    EXPECT_FALSE(closedTwice.IsOpened());
    EXPECT_EQ(OpenDescriptorCount(), before);
}

TEST(FileOpen, ClosedObjectRefusesStreamOperations)
{
    CTqovixFile file;
    long long value = 0;
    unsigned int count = 99;
    uint8_t byte = 0;
    EXPECT_EQ(file.GetPosition(&value), eTqovixErrorInternal);
    EXPECT_EQ(file.Seek(0, CTqovixFile::eTqovixSeekBegin), eTqovixErrorInternal);
    EXPECT_EQ(file.GetFileSize(&value), eTqovixErrorInternal);
    EXPECT_EQ(file.SetFileSize(0), eTqovixErrorInternal);
    EXPECT_EQ(file.Write(&byte, 1), eTqovixErrorInternal);
    EXPECT_EQ(file.Flush(), eTqovixErrorInternal);
    EXPECT_EQ(file.Read(&byte, &count, 1), eTqovixErrorInternal);
    EXPECT_EQ(count, 0u);

    // An empty read or write never reaches the stream, so it succeeds even here.
    count = 99;
    EXPECT_EQ(file.Read(&byte, &count, 0), eTqovixSuccess);
    EXPECT_EQ(count, 0u);
    EXPECT_EQ(file.Write(&byte, 0), eTqovixSuccess);
}

TEST(FileRead, ShortReadAtEndIsNotAnError)
{
    TempDir temp;
    const std::string path = temp.File("source.mov");
    const std::vector<uint8_t> content = Pattern(100, 7);
    ASSERT_TRUE(testsupport::WriteFile(path, content));

    CTqovixFile file;
    ASSERT_EQ(file.Open(path.c_str(), 1), eTqovixSuccess);
    ASSERT_EQ(file.Seek(60, CTqovixFile::eTqovixSeekBegin), eTqovixSuccess);

    std::vector<uint8_t> buffer(100, 0xEE);
    unsigned int count = 0;
    EXPECT_EQ(file.Read(buffer.data(), &count, 100), eTqovixSuccess);
    ASSERT_EQ(count, 40u);
    EXPECT_TRUE(std::equal(buffer.begin(), buffer.begin() + 40, content.begin() + 60));
    EXPECT_EQ(buffer[40], 0xEE);

    count = 77;
    EXPECT_EQ(file.Read(buffer.data(), &count, 100), eTqovixSuccess);
    EXPECT_EQ(count, 0u);

    ASSERT_EQ(file.Seek(10, CTqovixFile::eTqovixSeekBegin), eTqovixSuccess);
    count = 77;
    EXPECT_EQ(file.Read(buffer.data(), &count, 0), eTqovixSuccess);
    EXPECT_EQ(count, 0u);
    long long position = -1;
    EXPECT_EQ(file.GetPosition(&position), eTqovixSuccess);
    EXPECT_EQ(position, 10);
}

TEST(FileRead, FailingReadIsConvertedFromErrno)
{
    // Address 0 is never mapped, so reading the process's own memory there fails with EIO.
    CTqovixFile file;
    ASSERT_EQ(file.Open("/proc/self/mem", 1), eTqovixSuccess);
    std::vector<uint8_t> buffer(16);
    unsigned int count = 99;
    EXPECT_EQ(file.Read(buffer.data(), &count, 16), eTqovixErrorGeneral);
    EXPECT_EQ(count, 0u);
}

TEST(FileWrite, WrittenBytesReadBackAndOpeningForWritingTruncates)
{
    TempDir temp;
    const std::string path = temp.File("destination.mov");
    ASSERT_TRUE(testsupport::WriteFile(path, Pattern(5000, 3)));

    const std::vector<uint8_t> first = Pattern(3000, 11);
    const std::vector<uint8_t> second = Pattern(20000, 42);
    {
        CTqovixFile file;
        ASSERT_EQ(file.Open(path.c_str(), 2), eTqovixSuccess);
        long long size = -1;
        ASSERT_EQ(file.GetFileSize(&size), eTqovixSuccess);
        EXPECT_EQ(size, 0);

        EXPECT_EQ(file.Write(first.data(), static_cast<unsigned int>(first.size())), eTqovixSuccess);
        EXPECT_EQ(file.Write(second.data(), 0), eTqovixSuccess);
        EXPECT_EQ(file.Write(second.data(), static_cast<unsigned int>(second.size())), eTqovixSuccess);
        long long position = -1;
        EXPECT_EQ(file.GetPosition(&position), eTqovixSuccess);
        EXPECT_EQ(position, 23000);

        // Read back through the same stream, as the writer does when it patches headers.
        ASSERT_EQ(file.Seek(2990, CTqovixFile::eTqovixSeekBegin), eTqovixSuccess);
        std::vector<uint8_t> buffer(20);
        unsigned int count = 0;
        ASSERT_EQ(file.Read(buffer.data(), &count, 20), eTqovixSuccess);
        ASSERT_EQ(count, 20u);
        EXPECT_TRUE(std::equal(buffer.begin(), buffer.begin() + 10, first.begin() + 2990));
        EXPECT_TRUE(std::equal(buffer.begin() + 10, buffer.end(), second.begin()));
        EXPECT_EQ(file.Flush(), eTqovixSuccess);
    }
    std::vector<uint8_t> expected = first;
    expected.insert(expected.end(), second.begin(), second.end());
    EXPECT_EQ(testsupport::ReadFile(path), expected);
}

TEST(FileWrite, DeviceRefusingBytesIsReportedAtWriteOrFlush)
{
    CTqovixFile file;
    ASSERT_EQ(file.Open("/dev/full", 2), eTqovixSuccess);

    // A small write only fills the stream's buffer; the device's refusal surfaces at the flush.
    const std::vector<uint8_t> small = Pattern(16, 1);
    EXPECT_EQ(file.Write(small.data(), static_cast<unsigned int>(small.size())), eTqovixSuccess);
    EXPECT_EQ(file.Flush(), eTqovixErrorDiskFull);

    const std::vector<uint8_t> large = Pattern(1 << 20, 2);
    EXPECT_EQ(file.Write(large.data(), static_cast<unsigned int>(large.size())), eTqovixErrorDiskFull);
}

TEST(FileWrite, FileSizeLimitIsConvertedAndEndOfFileTakesPrecedence)
{
    TempDir temp;
    const std::string path = temp.File("limited.mov");
    const auto codes = RunInChild(
        [&path] {
            std::signal(SIGXFSZ, SIG_IGN);
            const rlimit limit{4096, 4096};
            setrlimit(RLIMIT_FSIZE, &limit);
            const std::vector<uint8_t> bytes = Pattern(1 << 16, 5);
            CTqovixFile file;
            std::vector<int> result;
            result.push_back(file.Open(path.c_str(), 2));
            result.push_back(file.Write(bytes.data(), static_cast<unsigned int>(bytes.size())));
            // Reading to the end sets the stream's end-of-file indicator before the next write fails.
            result.push_back(file.Seek(0, CTqovixFile::eTqovixSeekEnd));
            uint8_t byte = 0;
            unsigned int count = 99;
            result.push_back(file.Read(&byte, &count, 1));
            result.push_back(static_cast<int>(count));
            result.push_back(file.Write(bytes.data(), static_cast<unsigned int>(bytes.size())));
            return result;
        },
        false);
    ASSERT_TRUE(codes.has_value());
    const std::vector<int> expected = {eTqovixSuccess, eTqovixErrorInvalidArgument, eTqovixSuccess,
                                       eTqovixSuccess, 0,                           eTqovixErrorEndOfFile};
    EXPECT_EQ(*codes, expected);
}

TEST(FileAccess, PermissionFailuresDistinguishSourceFromDestination)
{
    TempDir temp;
    ASSERT_EQ(chmod(temp.Path().c_str(), 0755), 0);
    const std::string locked = temp.File("locked.mov");
    ASSERT_TRUE(testsupport::WriteFile(locked, Pattern(64, 9)));
    ASSERT_EQ(chmod(locked.c_str(), 0), 0);

    const std::string sealed = temp.File("sealed");
    ASSERT_TRUE(fs::create_directory(sealed));
    const std::string kept = sealed + "/kept.mov";
    ASSERT_TRUE(testsupport::WriteFile(kept, Pattern(8, 1)));
    ASSERT_EQ(chmod(sealed.c_str(), 0555), 0);

    // Readable but not searchable: the directory test cannot enter it, so only the read finds out.
    const std::string listOnly = temp.File("list-only");
    ASSERT_TRUE(fs::create_directory(listOnly));
    ASSERT_EQ(chmod(listOnly.c_str(), 0444), 0);

    const std::string created = sealed + "/new.mov";
    const auto codes = RunInChild(
        [&] {
            std::vector<int> result;
            CTqovixFile source;
            result.push_back(source.Open(locked.c_str(), 1));
            CTqovixFile destination;
            result.push_back(destination.Open(created.c_str(), 2));
            result.push_back(CTqovixFile::Delete(kept.c_str()));
            CTqovixFile directory;
            result.push_back(directory.Open(listOnly.c_str(), 1));
            uint8_t byte = 0;
            unsigned int count = 99;
            result.push_back(directory.Read(&byte, &count, 1));
            result.push_back(static_cast<int>(count));
            return result;
        },
        true);
    ASSERT_TRUE(codes.has_value());
    const std::vector<int> expected = {eTqovixErrorSourceAccessDenied,
                                       eTqovixErrorDestinationAccessDenied,
                                       eTqovixErrorDestinationAccessDenied,
                                       eTqovixSuccess,
                                       eTqovixErrorIsDirectory,
                                       0};
    EXPECT_EQ(*codes, expected);
    EXPECT_TRUE(fs::exists(kept));
    EXPECT_FALSE(fs::exists(created));
}

TEST(FileSize, GetFileSizeKeepsPositionAndSetFileSizeResizes)
{
    TempDir temp;
    const std::string path = temp.File("sized.mov");
    const std::vector<uint8_t> content = Pattern(1000, 21);
    ASSERT_TRUE(testsupport::WriteFile(path, content));

    {
        CTqovixFile file;
        ASSERT_EQ(file.Open(path.c_str(), 1), eTqovixSuccess);
        ASSERT_EQ(file.Seek(123, CTqovixFile::eTqovixSeekBegin), eTqovixSuccess);
        long long size = -1;
        ASSERT_EQ(file.GetFileSize(&size), eTqovixSuccess);
        EXPECT_EQ(size, 1000);
        long long position = -1;
        EXPECT_EQ(file.GetPosition(&position), eTqovixSuccess);
        EXPECT_EQ(position, 123);
        uint8_t byte = 0;
        unsigned int count = 0;
        ASSERT_EQ(file.Read(&byte, &count, 1), eTqovixSuccess);
        EXPECT_EQ(byte, content[123]);
        EXPECT_EQ(file.Seek(-1, CTqovixFile::eTqovixSeekBegin), eTqovixErrorInvalidArgument);
    }

    CTqovixFile file;
    ASSERT_EQ(file.Open(path.c_str(), 2), eTqovixSuccess);
    ASSERT_EQ(file.Write(content.data(), 1000), eTqovixSuccess);

    ASSERT_EQ(file.SetFileSize(2000), eTqovixSuccess);
    EXPECT_EQ(fs::file_size(path), 2000u);
    ASSERT_EQ(file.Seek(990, CTqovixFile::eTqovixSeekBegin), eTqovixSuccess);
    std::vector<uint8_t> buffer(20);
    unsigned int count = 0;
    ASSERT_EQ(file.Read(buffer.data(), &count, 20), eTqovixSuccess);
    ASSERT_EQ(count, 20u);
    EXPECT_TRUE(std::equal(buffer.begin(), buffer.begin() + 10, content.begin() + 990));
    EXPECT_EQ(std::vector<uint8_t>(buffer.begin() + 10, buffer.end()), std::vector<uint8_t>(10, 0));

    // Bytes read ahead into the stream's buffer must not outlive a truncation.
    ASSERT_EQ(file.Seek(0, CTqovixFile::eTqovixSeekBegin), eTqovixSuccess);
    ASSERT_EQ(file.Read(buffer.data(), &count, 1), eTqovixSuccess);
    ASSERT_EQ(file.SetFileSize(10), eTqovixSuccess);
    ASSERT_EQ(file.Read(buffer.data(), &count, 20), eTqovixSuccess);
    EXPECT_EQ(count, 9u);

    // Nor may bytes still waiting to be written re-extend the file after it.
    ASSERT_EQ(file.Seek(0, CTqovixFile::eTqovixSeekEnd), eTqovixSuccess);
    ASSERT_EQ(file.Write(content.data(), 50), eTqovixSuccess);
    ASSERT_EQ(file.SetFileSize(5), eTqovixSuccess);
    file.Close();
    EXPECT_EQ(testsupport::ReadFile(path), std::vector<uint8_t>(content.begin(), content.begin() + 5));
}

TEST(FileSize, PositionsBeyondFourGiB)
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
    long long value = -1;
    EXPECT_EQ(file.GetPosition(&value), eTqovixSuccess);
    EXPECT_EQ(value, offset + 16);
    ASSERT_EQ(file.Seek(-8, CTqovixFile::eTqovixSeekCurrent), eTqovixSuccess);
    EXPECT_EQ(file.GetFileSize(&value), eTqovixSuccess);
    EXPECT_EQ(value, offset + 16);
    EXPECT_EQ(file.GetPosition(&value), eTqovixSuccess);
    EXPECT_EQ(value, offset + 8);
    ASSERT_EQ(file.Flush(), eTqovixSuccess);
    EXPECT_EQ(fs::file_size(path), static_cast<uintmax_t>(offset + 16));

    ASSERT_EQ(file.Seek(-16, CTqovixFile::eTqovixSeekEnd), eTqovixSuccess);
    std::vector<uint8_t> buffer(32, 0xEE);
    unsigned int count = 0;
    ASSERT_EQ(file.Read(buffer.data(), &count, 32), eTqovixSuccess);
    ASSERT_EQ(count, 16u);
    EXPECT_TRUE(std::equal(tail.begin(), tail.end(), buffer.begin()));

    ASSERT_EQ(file.SetFileSize(6 * kGiB), eTqovixSuccess);
    EXPECT_EQ(fs::file_size(path), static_cast<uintmax_t>(6 * kGiB));
    ASSERT_EQ(file.SetFileSize(4096), eTqovixSuccess);
    EXPECT_EQ(fs::file_size(path), 4096u);
    EXPECT_EQ(file.GetFileSize(&value), eTqovixSuccess);
    EXPECT_EQ(value, 4096);
}

// A volume the test describes, standing in for statfs.
struct FakeVolume {
    static inline TqovixVolumeInformation information;
    static inline bool fails = false;
    static inline int calls = 0;
    static inline std::string lastDirectory;

    static bool Query(const char* directory, TqovixVolumeInformation* out)
    {
        ++calls;
        lastDirectory = directory;
        if (fails) {
            errno = EACCES;
            return false;
        }
        *out = information;
        return true;
    }
};

class FileComfirmWritable : public ::testing::Test {
protected:
    void SetUp() override
    {
        FakeVolume::information = {};
        FakeVolume::fails = false;
        FakeVolume::calls = 0;
        FakeVolume::lastDirectory.clear();
        m_previous = CTqovixFile::SetVolumeQuery(&FakeVolume::Query);
    }
    void TearDown() override { CTqovixFile::SetVolumeQuery(m_previous); }

    static int Check(uint32_t blockSize, uint64_t blocks, const char* type, long long size)
    {
        FakeVolume::information = {blockSize, blocks, type};
        CTqovixFile file;
        return file.ComfirmWritable(size, "/volume/out.mov");
    }

private:
    TqovixVolumeQuery m_previous = nullptr;
};

TEST_F(FileComfirmWritable, RequiredSpaceIsNineTenthsOfTheSourceAndEqualityRefuses)
{
    EXPECT_EQ(Check(1, 1000, "ext4", 1000), eTqovixSuccess);
    EXPECT_EQ(Check(1, 900, "ext4", 1000), eTqovixErrorDiskFull);
    EXPECT_EQ(Check(100, 9, "ext4", 1000), eTqovixErrorDiskFull);
    EXPECT_EQ(Check(1, 0, "ext4", 1), eTqovixErrorDiskFull);
    // 8 GiB available only as a 64-bit product of block size and count.
    EXPECT_EQ(Check(4096, 1ULL << 21, "ext4", 8 * kGiB), eTqovixSuccess);
    EXPECT_EQ(Check(4096, 1ULL << 21, "ext4", 9 * kGiB), eTqovixErrorDiskFull);
}

TEST_F(FileComfirmWritable, FatVolumeRefusesFilesOfFourGiB)
{
    const uint64_t ample = 1ULL << 30;  // 4 TiB in 4 KiB blocks
    EXPECT_EQ(Check(4096, ample, "msdos", 4772185884LL), eTqovixErrorFileTooLarge);
    EXPECT_EQ(Check(4096, ample, "msdos", 4772185883LL), eTqovixSuccess);
    EXPECT_EQ(Check(4096, ample, "ext4", 4772185884LL), eTqovixSuccess);
    EXPECT_EQ(Check(4096, ample, "exfat", 4772185884LL), eTqovixSuccess);
    // Lack of space is reported before the size limit.
    EXPECT_EQ(Check(1, 1000, "msdos", 4772185884LL), eTqovixErrorDiskFull);
}

TEST_F(FileComfirmWritable, AsksAboutTheDirectoryAndReportsUnusablePaths)
{
    FakeVolume::information = {4096, 1000, "ext4"};
    CTqovixFile file;
    char path[] = "/media/card/clips/out.mov";
    EXPECT_EQ(file.ComfirmWritable(10, path), eTqovixSuccess);
    EXPECT_EQ(FakeVolume::lastDirectory, "/media/card/clips");
    EXPECT_STREQ(path, "/media/card/clips/out.mov");
    EXPECT_EQ(file.ComfirmWritable(10, "out.mov"), eTqovixSuccess);
    EXPECT_EQ(FakeVolume::lastDirectory, ".");

    FakeVolume::fails = true;
    EXPECT_EQ(file.ComfirmWritable(10, path), eTqovixErrorDestinationNotFound);

    const int callsBefore = FakeVolume::calls;
    EXPECT_EQ(file.ComfirmWritable(10, ""), eTqovixErrorGeneral);
    EXPECT_EQ(file.ComfirmWritable(10, nullptr), eTqovixErrorGeneral);
    EXPECT_EQ(FakeVolume::calls, callsBefore);
}

TEST_F(FileComfirmWritable, NullQueryRestoresTheRealVolume)
{
    EXPECT_EQ(CTqovixFile::SetVolumeQuery(nullptr), &FakeVolume::Query);
    TempDir temp;
    CTqovixFile file;
    EXPECT_EQ(file.ComfirmWritable(1000, temp.File("out.mov").c_str()), eTqovixSuccess);
    EXPECT_EQ(file.ComfirmWritable(1LL << 62, temp.File("out.mov").c_str()), eTqovixErrorDiskFull);
    EXPECT_EQ(file.ComfirmWritable(1000, temp.File("missing/out.mov").c_str()), eTqovixErrorDestinationNotFound);
    EXPECT_EQ(FakeVolume::calls, 0);
}

TEST(FileVolumeQuery, StatfsFiguresAndTypeNames)
{
    TempDir temp;
    TqovixVolumeInformation information;
    ASSERT_TRUE(CTqovixFile::QueryVolume(temp.Path().c_str(), &information));
    EXPECT_GT(information.blockSize, 0u);
    EXPECT_GT(information.blocksAvailable, 0u);
    EXPECT_NE(information.typeName, "msdos");
    EXPECT_FALSE(information.typeName.empty());

    ASSERT_TRUE(CTqovixFile::QueryVolume("/proc", &information));
    EXPECT_EQ(information.typeName, "proc");

    errno = 0;
    EXPECT_FALSE(CTqovixFile::QueryVolume(temp.File("missing").c_str(), &information));
    EXPECT_EQ(errno, ENOENT);
}

TEST(FileDelete, RemovesFilesAndReportsUnusablePaths)
{
    TempDir temp;
    const std::string path = temp.File("victim.mov");
    ASSERT_TRUE(testsupport::WriteFile(path, Pattern(4, 0)));

    EXPECT_EQ(CTqovixFile::Delete(""), eTqovixErrorGeneral);
    EXPECT_EQ(CTqovixFile::Delete(nullptr), eTqovixErrorGeneral);
    EXPECT_EQ(CTqovixFile::Delete(temp.File("missing.mov").c_str()), eTqovixErrorDestinationNotFound);
    EXPECT_EQ(CTqovixFile::Delete(temp.Path().c_str()), eTqovixErrorIsDirectory);
    EXPECT_TRUE(fs::exists(temp.Path()));
    EXPECT_EQ(CTqovixFile::Delete(path.c_str()), eTqovixSuccess);
    EXPECT_FALSE(fs::exists(path));
}

struct ErrnoCase {
    const char* name;
    int errorNumber;
    bool readOnly;
    int expected;
};

class FileConvertErrno : public ::testing::TestWithParam<ErrnoCase> {};

TEST_P(FileConvertErrno, MapsToInternalCode)
{
    const ErrnoCase& c = GetParam();
    EXPECT_EQ(CTqovixFile::ConvertErrnoToLocalError(c.errorNumber, c.readOnly), c.expected);
}

INSTANTIATE_TEST_SUITE_P(
    Table, FileConvertErrno,
    ::testing::Values(ErrnoCase{"EPERM_source", EPERM, true, eTqovixErrorSourceAccessDenied},
                      ErrnoCase{"EPERM_destination", EPERM, false, eTqovixErrorDestinationAccessDenied},
                      ErrnoCase{"EACCES_source", EACCES, true, eTqovixErrorSourceAccessDenied},
                      ErrnoCase{"EACCES_destination", EACCES, false, eTqovixErrorDestinationAccessDenied},
                      ErrnoCase{"ENOENT_source", ENOENT, true, eTqovixErrorSourceNotFound},
                      ErrnoCase{"ENOENT_destination", ENOENT, false, eTqovixErrorDestinationNotFound},
                      ErrnoCase{"ENOMEM", ENOMEM, true, eTqovixErrorOutOfMemory},
                      ErrnoCase{"ENOSPC", ENOSPC, false, eTqovixErrorDiskFull},
                      ErrnoCase{"EEXIST", EEXIST, false, eTqovixErrorFileExists},
                      ErrnoCase{"ENFILE", ENFILE, true, eTqovixErrorTooManyFiles},
                      ErrnoCase{"EMFILE", EMFILE, false, eTqovixErrorTooManyFiles},
                      ErrnoCase{"EISDIR", EISDIR, true, eTqovixErrorIsDirectory},
                      ErrnoCase{"E2BIG", E2BIG, true, eTqovixErrorInvalidArgument},
                      ErrnoCase{"EINVAL", EINVAL, true, eTqovixErrorInvalidArgument},
                      ErrnoCase{"EFBIG", EFBIG, false, eTqovixErrorInvalidArgument},
                      ErrnoCase{"ESPIPE", ESPIPE, true, eTqovixErrorInvalidArgument},
                      ErrnoCase{"EROFS", EROFS, false, eTqovixErrorInvalidArgument},
                      ErrnoCase{"EDOM", EDOM, true, eTqovixErrorInvalidArgument},
                      ErrnoCase{"ENAMETOOLONG", ENAMETOOLONG, true, eTqovixErrorInvalidArgument},
                      ErrnoCase{"EOVERFLOW", EOVERFLOW, true, eTqovixErrorInvalidArgument},
                      ErrnoCase{"ENXIO", ENXIO, true, eTqovixErrorDevice},
                      ErrnoCase{"ENOTBLK", ENOTBLK, true, eTqovixErrorDevice},
                      ErrnoCase{"EBUSY", EBUSY, false, eTqovixErrorDevice},
                      ErrnoCase{"EXDEV", EXDEV, false, eTqovixErrorDevice},
                      ErrnoCase{"ENODEV", ENODEV, true, eTqovixErrorDevice},
                      ErrnoCase{"ENOTEMPTY", ENOTEMPTY, false, eTqovixErrorInternal},
                      ErrnoCase{"EIO", EIO, true, eTqovixErrorGeneral},
                      ErrnoCase{"EAGAIN", EAGAIN, false, eTqovixErrorGeneral},
                      ErrnoCase{"ELOOP", ELOOP, true, eTqovixErrorGeneral},
                      ErrnoCase{"highest_EHWPOISON", EHWPOISON, true, eTqovixErrorGeneral},
                      ErrnoCase{"above_highest", EHWPOISON + 1, true, eTqovixErrorInternal},
                      ErrnoCase{"zero", 0, true, eTqovixErrorInternal},
                      ErrnoCase{"negative", -1, false, eTqovixErrorInternal},
                      ErrnoCase{"INT_MIN", INT_MIN, false, eTqovixErrorInternal},
                      ErrnoCase{"huge", 100000, true, eTqovixErrorInternal}),
    [](const ::testing::TestParamInfo<ErrnoCase>& info) { return std::string(info.param.name); });

TEST(FileUtil, IsSameFileFollowsSpellingsAndLinks)
{
    TempDir temp;
    const std::string a = temp.File("a.mov");
    const std::string b = temp.File("b.mov");
    ASSERT_TRUE(testsupport::WriteFile(a, Pattern(4, 1)));
    ASSERT_TRUE(testsupport::WriteFile(b, Pattern(4, 1)));
    const std::string link = temp.File("link.mov");
    ASSERT_EQ(symlink(a.c_str(), link.c_str()), 0);
    const std::string hardLink = temp.File("hard.mov");
    ASSERT_EQ(::link(a.c_str(), hardLink.c_str()), 0);

    CwdGuard restore;
    fs::current_path(temp.Path());
    EXPECT_TRUE(CTqovixUtil::IsSameFile("a.mov", a.c_str()));
    const std::string roundabout = "../" + fs::path(temp.Path()).filename().string() + "/./a.mov";
    EXPECT_TRUE(CTqovixUtil::IsSameFile(roundabout.c_str(), "a.mov"));
    EXPECT_TRUE(CTqovixUtil::IsSameFile(link.c_str(), a.c_str()));
    EXPECT_TRUE(CTqovixUtil::IsSameFile(hardLink.c_str(), "link.mov"));
    // Same content is not the same file.
    EXPECT_FALSE(CTqovixUtil::IsSameFile(a.c_str(), b.c_str()));
    EXPECT_FALSE(CTqovixUtil::IsSameFile(a.c_str(), "missing.mov"));
    EXPECT_FALSE(CTqovixUtil::IsSameFile("missing.mov", "missing.mov"));
    EXPECT_FALSE(CTqovixUtil::IsSameFile(nullptr, a.c_str()));
    EXPECT_FALSE(CTqovixUtil::IsSameFile(a.c_str(), nullptr));
}

TEST(FileUtil, MemcpyCopiesExactlyTheRequestedBytes)
{
    const std::vector<uint8_t> source = Pattern(8, 1);
    std::vector<uint8_t> destination(12, 0xAA);
    CTqovixUtil::_memcpy(destination.data(), destination.size(), source.data(), 8);
    EXPECT_TRUE(std::equal(source.begin(), source.end(), destination.begin()));
    EXPECT_EQ(std::vector<uint8_t>(destination.begin() + 8, destination.end()), std::vector<uint8_t>(4, 0xAA));
    // Empty buffers hand over null pointers; the undefined-behaviour sanitizer watches this call.
    CTqovixUtil::_memcpy(nullptr, 0, nullptr, 0);
}

}  // namespace

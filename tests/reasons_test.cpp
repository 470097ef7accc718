// The reasons library as the Python module loads it: what it exports, and words that always
// fit the caller's buffers as valid UTF-8.
#include "reasons/TqovixReasons.h"
#include "support/TestSupport.h"

#include <gtest/gtest.h>

#include <set>
#include <string>
#include <vector>

namespace {

using testsupport::PrintTo;
using testsupport::TempDir;

// Anything more would let a host's lookups land in this copy of the engine, not the library's.
TEST(ReasonsTest, ExportsOnlyItsEntries)
{
    EXPECT_EQ(testsupport::ExportedNames(TQOVIX_REASONS_FILE),
              (std::set<std::string>{"TqovixAboutDestination", "TqovixCheckDestination", "TqovixExplain", "TqovixReasonWords"}));
}

// A camera-like start whose brand reads "©abc": its words hold a two-byte character.
std::string ForeignBrandFile(const TempDir& dir)
{
    const std::string path = dir.File("brand.mov");
    const std::vector<uint8_t> ftyp = {0, 0, 0, 16, 'f', 't', 'y', 'p', 0xA9, 'a', 'b', 'c', 0, 0, 0, 0};
    EXPECT_TRUE(testsupport::WriteFile(path, ftyp));
    return path;
}

struct CutCase {
    const char* name;
    size_t textSize;
    std::string text;
};

class ReasonsCutTest : public ::testing::TestWithParam<CutCase> {};

TEST_P(ReasonsCutTest, WordsAreCutBeforeACharacterNeverInsideIt)
{
    const CutCase& row = GetParam();
    TempDir dir;
    const std::string source = ForeignBrandFile(dir);
    char key[32];
    std::string text(row.textSize + 1, 'x');  // one byte past the buffer must stay untouched
    EXPECT_EQ(TqovixExplain(8, source.c_str(), nullptr, key, sizeof key, text.data(), row.textSize), 8);
    EXPECT_STREQ(key, "wrong-brand");
    EXPECT_EQ(text.c_str(), row.text);
    EXPECT_EQ(text.back(), 'x');
}

const CutCase kCuts[] = {
    {"Whole", 64, "not a camera movie (brand '\xc2\xa9" "abc')"},
    {"InsideTheCharacter", 29, "not a camera movie (brand '"},
    {"AfterTheCharacter", 30, "not a camera movie (brand '\xc2\xa9"},
    {"OnlyTheTerminator", 1, ""},
};

INSTANTIATE_TEST_SUITE_P(Rows, ReasonsCutTest, ::testing::ValuesIn(kCuts), testsupport::ByName);

TEST(ReasonsTest, NoBuffersAndUnknownKeysAreAnswered)
{
    TempDir dir;
    const std::string source = ForeignBrandFile(dir);
    EXPECT_EQ(TqovixExplain(8, source.c_str(), nullptr, nullptr, 0, nullptr, 0), 8);
    EXPECT_EQ(TqovixExplain(0, nullptr, nullptr, nullptr, 0, nullptr, 0), 0);
    char text[64] = "stale";
    EXPECT_EQ(TqovixReasonWords("no-such-reason", text, sizeof text), -2);
    EXPECT_STREQ(text, "");
    EXPECT_EQ(TqovixReasonWords(nullptr, text, sizeof text), -2);
    EXPECT_EQ(TqovixReasonWords("destination-exists", text, sizeof text), -1);
    EXPECT_STREQ(text, "the destination exists");
    EXPECT_EQ(TqovixAboutDestination(nullptr), 0);
    EXPECT_EQ(TqovixAboutDestination("same-file"), 1);
    EXPECT_EQ(TqovixAboutDestination("source-missing"), 0);
}

}  // namespace

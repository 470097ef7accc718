#include <gtest/gtest.h>

#include <string>
#include <vector>

#include "ByteWriter.h"
#include "atom/CTqovixAtomControl.h"
#include "atom/CTqovixContainerAtom.h"
#include "atom/CTqovixLeafAtom.h"
#include "atom/CTqovixTCTGAtom.h"
#include "file/CTqovixFile.h"
#include "support/TestSupport.h"
#include "visitor/CTqovixMakerBlockVisitor.h"
#include "visitor/CTqovixTCTGAtomVisitor.h"
#include "visitor/CTqovixTrimInformationVisitor.h"

using moviekit::Atom;
using moviekit::Bytes;
using moviekit::Container;

namespace {

Bytes Tag(uint16_t group, uint16_t number, uint16_t type, uint16_t count, const Bytes& values)
{
    Bytes out;
    moviekit::PutU16(out, group);
    moviekit::PutU16(out, number);
    moviekit::PutU16(out, type);
    moviekit::PutU16(out, count);
    moviekit::PutBytes(out, values);
    return out;
}

Bytes Longs(std::initializer_list<uint32_t> values)
{
    Bytes out;
    for (uint32_t value : values) {
        moviekit::PutU32(out, value);
    }
    return out;
}

Bytes Ascii(const std::string& text)
{
    Bytes out(text.begin(), text.end());
    out.push_back(0);
    return out;
}

const Bytes kForward = Tag(0, 20, 4, 2, Longs({12, 0}));
const Bytes kBackward = Tag(0, 21, 4, 2, Longs({7, 0}));
const Bytes kRate = Tag(0, 22, 5, 1, Longs({30000, 1001}));

Bytes SoftwareTag()
{
    return Tag(0, 3, 2, 19, Ascii("VELDA OVIX Utility"));
}

// A movie whose maker data holds the given tag payload and maker blocks.
Bytes MovieWith(const Bytes& tags, const std::vector<Bytes>& makerBlocks = {})
{
    Bytes ftyp;
    moviekit::PutString(ftyp, "qt  ");
    moviekit::PutU32(ftyp, 0);
    return moviekit::Concat(
        {Atom("ftyp", ftyp),
         Container("moov", {Atom("mvhd", Bytes(100, 1)),
                            Container("udta", {Container("TCDT", {Container("TCDB", makerBlocks), Atom("TCTG", tags)})})}),
         Atom("mdat", Bytes(16, 2))});
}

const CTqovixLeafAtom* FindLeaf(const TqovixAtomList& atoms, const TqovixAtomPath& path, size_t depth)
{
    for (const auto& atom : atoms) {
        if (atom->GetType() != path[depth]) {
            continue;
        }
        if (depth + 1 == path.size()) {
            return dynamic_cast<const CTqovixLeafAtom*>(atom.get());
        }
        if (const auto* container = dynamic_cast<const CTqovixContainerAtom*>(atom.get())) {
            return FindLeaf(container->GetChildren(), path, depth + 1);
        }
    }
    return nullptr;
}

class TagTreeTest : public ::testing::Test {
protected:
    void Load(const Bytes& movie)
    {
        m_tree.Close();
        if (m_file.IsOpened()) {
            m_file.Close();
        }
        const std::string path = m_dir.File("movie" + std::to_string(m_loads++) + ".mov");
        ASSERT_TRUE(testsupport::WriteFile(path, movie));
        ASSERT_EQ(m_file.Open(path.c_str(), 1), eTqovixSuccess);
        ASSERT_EQ(m_tree.Initialize(m_file), eTqovixSuccess);
    }

    Bytes TagPayload()
    {
        TqovixAtomList atoms;
        m_tree.GetAtoms(atoms);
        const auto* leaf = FindLeaf(atoms, TqovixMakeAtomPath("moovudtaTCDTTCTG"), 0);
        if (leaf == nullptr || leaf->GetData() == nullptr) {
            return {};
        }
        return Bytes(leaf->GetData(), leaf->GetData() + leaf->GetDataSize());
    }

    testsupport::TempDir m_dir;
    CTqovixFile m_file;
    CTqovixAtomControl m_tree;
    int m_loads = 0;
};

TEST(TagCursorTest, WalksTagsAndReadsValuesOfTheirSize)
{
    const Bytes payload = moviekit::Concat({kRate, Tag(0, 3, 2, 19, Ascii("012345678901234567")), kForward});
    CTqovixTCTGAtom tags(payload.data(), payload.size());
    ASSERT_TRUE(tags.FindNextTag());
    EXPECT_EQ(tags.GetTagNumber(), 22);
    EXPECT_EQ(tags.GetTagSize(), 16u);
    std::vector<TCTG::TqovixURational> rationals;
    tags.GetTagData(rationals);
    ASSERT_EQ(rationals.size(), 1u);
    EXPECT_EQ(rationals[0].numerator, 30000u);
    EXPECT_EQ(rationals[0].denominator, 1001u);
    std::vector<uint32_t> longs = {99};
    tags.GetTagData(longs);
    EXPECT_TRUE(longs.empty());

    ASSERT_TRUE(tags.FindNextTag());
    EXPECT_EQ(tags.GetTagType(), 2);
    EXPECT_EQ(tags.GetTagSize(), 27u);
    ASSERT_TRUE(tags.FindNextTag());
    tags.GetTagData(longs);
    EXPECT_EQ(longs, (std::vector<uint32_t>{12, 0}));
    EXPECT_FALSE(tags.FindNextTag());
    EXPECT_FALSE(tags.FindNextTag());
    EXPECT_EQ(tags.GetTagGroup(), 0);
    EXPECT_EQ(tags.GetTagSize(), 8u);

    CTqovixTCTGAtom empty(nullptr, 10);
    EXPECT_FALSE(empty.FindNextTag());
    EXPECT_EQ(empty.GetTagNumber(), 0);
    EXPECT_EQ(empty.GetTagDataSize(), 1u);
    EXPECT_EQ(empty.GetTagSize(), 8u);
}

TEST(TagCursorTest, StopsAtTagsRunningPastThePayload)
{
    // A count of 65535 LONGs in a 20-byte payload, and a header cut short.
    const Bytes runaway = moviekit::Concat({kRate, Tag(0, 20, 4, 65535, Longs({1}))});
    CTqovixTCTGAtom tags(runaway.data(), runaway.size());
    ASSERT_TRUE(tags.FindNextTag());
    EXPECT_FALSE(tags.FindNextTag());
    EXPECT_EQ(tags.GetTagCount(), 0);
    std::vector<uint32_t> longs;
    tags.GetTagData(longs);
    EXPECT_TRUE(longs.empty());

    const Bytes cut = moviekit::Concat({kForward, Bytes{0, 0, 0, 21, 0}});
    CTqovixTCTGAtom cutTags(cut.data(), cut.size());
    ASSERT_TRUE(cutTags.FindNextTag());
    EXPECT_FALSE(cutTags.FindNextTag());
}

TEST(TagCursorTest, AppendTagWritesHeaderAndValues)
{
    TCTG::TqovixTCTGTag tag;
    tag.number = 3;
    tag.type = 2;
    tag.count = 19;
    tag.data = Ascii("VELDA OVIX Utility");
    Bytes out = {0xAA};
    EXPECT_TRUE(CTqovixTCTGAtom::AppendTag(out, tag));
    ASSERT_EQ(out.size(), 28u);
    EXPECT_EQ(Bytes(out.begin(), out.begin() + 9), (Bytes{0xAA, 0, 0, 0, 3, 0, 2, 0, 0x13}));
    EXPECT_EQ(Bytes(out.begin() + 1, out.end()), SoftwareTag());
}

struct TrimCase {
    const char* name;
    Bytes tags;
    eTqovixErrorCode expected;
    uint32_t forward, backward, numerator, denominator;
};

void PrintTo(const TrimCase& c, std::ostream* os) { *os << c.name; }


class TrimTest : public TagTreeTest, public ::testing::WithParamInterface<TrimCase> {};

TEST_P(TrimTest, ReadsTheThreeTrimTags)
{
    const TrimCase& c = GetParam();
    Load(MovieWith(c.tags));
    CTqovixTrimInformationVisitor visitor;
    EXPECT_EQ(m_tree.Analyze(visitor), c.expected);
    if (c.expected == eTqovixSuccess) {
        EXPECT_EQ(visitor.GetRemovedFrameForward(), c.forward);
        EXPECT_EQ(visitor.GetRemovedFrameBackward(), c.backward);
        EXPECT_EQ(visitor.GetFrameRateNumerator(), c.numerator);
        EXPECT_EQ(visitor.GetFrameRateDenominator(), c.denominator);
    }
    EXPECT_EQ(m_tree.Update(visitor), eTqovixErrorInternal) << "the trim visitor reads only";
}

const TrimCase kTrimCases[] = {
    {"InOrder", moviekit::Concat({kForward, kBackward, kRate}), eTqovixSuccess, 12, 7, 30000, 1001},
    {"AnyOrderAmongOthers", moviekit::Concat({SoftwareTag(), kRate, Tag(1, 20, 4, 2, Longs({5, 5})), kBackward, kForward}),
     eTqovixSuccess, 12, 7, 30000, 1001},
    {"ForwardWithOneValue", moviekit::Concat({Tag(0, 20, 4, 1, Longs({12})), kBackward, kRate}),
     eTqovixErrorInvalidMovie, 0, 0, 0, 0},
    {"SignedRational", moviekit::Concat({kForward, kBackward, Tag(0, 22, 10, 1, Longs({30000, 1001}))}),
     eTqovixErrorInvalidMovie, 0, 0, 0, 0},
    {"GroupOne", moviekit::Concat({Tag(1, 20, 4, 2, Longs({1, 0})), Tag(1, 21, 4, 2, Longs({1, 0})),
                                   Tag(1, 22, 5, 1, Longs({1, 1}))}),
     eTqovixErrorInvalidMovie, 0, 0, 0, 0},
    {"ForwardTwiceNoBackward", moviekit::Concat({kForward, Tag(0, 20, 4, 2, Longs({3, 0})), kRate}), eTqovixSuccess, 3, 0,
     30000, 1001},
    // Tags behind the third acceptance are never read, even a broken one.
    {"StopsAfterThird", moviekit::Concat({kForward, kBackward, kRate, Tag(0, 20, 4, 65535, {})}), eTqovixSuccess, 12, 7,
     30000, 1001},
    {"RunawayCount", moviekit::Concat({kForward, Tag(0, 21, 4, 65535, Longs({1, 2}))}), eTqovixErrorInvalidMovie, 0, 0, 0,
     0},
    {"EmptyTagAtom", {}, eTqovixErrorInvalidMovie, 0, 0, 0, 0},
};

INSTANTIATE_TEST_SUITE_P(Tags, TrimTest, ::testing::ValuesIn(kTrimCases),
                         [](const ::testing::TestParamInfo<TrimCase>& info) { return std::string(info.param.name); });

TEST_F(TagTreeTest, SoftwareNameReplacesTheFirstOldOneAndKeepsEverythingElse)
{
    const Bytes other = Tag(0, 1, 4, 1, Longs({42}));
    const Bytes foreignThree = Tag(1, 3, 2, 4, Ascii("abc"));
    const struct {
        Bytes before;
        Bytes after;
    } cases[] = {
        {moviekit::Concat({other, Tag(0, 3, 2, 6, Ascii("Maker")), foreignThree}),
         moviekit::Concat({other, SoftwareTag(), foreignThree})},
        {moviekit::Concat({other, Tag(0, 2, 3, 1, {0, 5})}), moviekit::Concat({other, Tag(0, 2, 3, 1, {0, 5}), SoftwareTag()})},
        {moviekit::Concat({Tag(0, 3, 2, 2, Ascii("a")), other, Tag(0, 3, 2, 3, Ascii("bb")), foreignThree}),
         moviekit::Concat({SoftwareTag(), other, foreignThree})},
        {Tag(0, 3, 2, 2, Ascii("a")), SoftwareTag()},
    };
    for (const auto& c : cases) {
        CTqovixAtomControl tree;
        CTqovixFile file;
        const std::string path = m_dir.File("software.mov");
        ASSERT_TRUE(testsupport::WriteFile(path, MovieWith(c.before)));
        ASSERT_EQ(file.Open(path.c_str(), 1), eTqovixSuccess);
        ASSERT_EQ(tree.Initialize(file), eTqovixSuccess);
        CTqovixTCTGAtomVisitor visitor;
        EXPECT_EQ(tree.Update(visitor), eTqovixSuccess);
        EXPECT_EQ(tree.Analyze(visitor), eTqovixErrorInternal) << "the software visitor only updates";
        TqovixAtomList atoms;
        tree.GetAtoms(atoms);
        const CTqovixLeafAtom* leaf = FindLeaf(atoms, TqovixMakeAtomPath("moovudtaTCDTTCTG"), 0);
        ASSERT_NE(leaf, nullptr);
        EXPECT_EQ(Bytes(leaf->GetData(), leaf->GetData() + leaf->GetDataSize()), c.after);
        // The moov grows or shrinks with the tag atom.
        EXPECT_EQ(atoms[1]->GetSize(), MovieWith(c.after).size() - 16 - 24);
    }
}

TEST_F(TagTreeTest, EmptyOrMissingTagAtomIsLeftAlone)
{
    Load(MovieWith({}));
    CTqovixTCTGAtomVisitor visitor;
    EXPECT_EQ(m_tree.Update(visitor), eTqovixVisitSkip);
    EXPECT_TRUE(TagPayload().empty());
}

TEST_F(TagTreeTest, MakerBlocksCopyOutWithHeaderAndGoBackAsPayload)
{
    Bytes afPayload(100);
    for (size_t i = 0; i < afPayload.size(); ++i) {
        afPayload[i] = static_cast<uint8_t>(i * 3);
    }
    Load(MovieWith(kRate, {Atom("OP01", afPayload), Atom("OP02", Bytes{'A', 'L', 'V', '1'})}));

    CTqovixAFInformationVisitor af;
    ASSERT_EQ(m_tree.Analyze(af), eTqovixSuccess);
    ASSERT_EQ(af.GetAFInformationSize(), 108u);
    const Bytes block(af.GetAFInformation(), af.GetAFInformation() + af.GetAFInformationSize());
    EXPECT_EQ(Bytes(block.begin(), block.begin() + 8), (Bytes{0, 0, 0, 0x6C, 'O', 'P', '0', '1'}));
    EXPECT_EQ(Bytes(block.begin() + 8, block.end()), afPayload);

    CTqovixAudioLevelInformationVisitor level;
    ASSERT_EQ(m_tree.Analyze(level), eTqovixSuccess);
    EXPECT_EQ(level.GetAudioLevelInformationSize(), 12u);

    // Setting the same block back gives the leaf the same payload.
    CTqovixAFInformationVisitor writer;
    Bytes processed = block;
    processed.back() ^= 0xFF;
    writer.SetAFInformation(processed.data(), processed.size());
    EXPECT_EQ(writer.GetAFInformationSize(), 100u);
    EXPECT_EQ(m_tree.Update(writer), eTqovixSuccess);
    CTqovixAFInformationVisitor reread;
    ASSERT_EQ(m_tree.Analyze(reread), eTqovixSuccess);
    EXPECT_EQ(Bytes(reread.GetAFInformation(), reread.GetAFInformation() + reread.GetAFInformationSize()), processed);

    // A size field of zero marks a 16-byte header.
    Bytes wide(24, 0);
    wide[20] = 0x5A;
    writer.SetAFInformation(wide.data(), wide.size());
    EXPECT_EQ(writer.GetAFInformationSize(), 8u);
    EXPECT_EQ(writer.GetAFInformation()[4], 0x5A);
    writer.SetAFInformation(wide.data(), 10);
    EXPECT_EQ(writer.GetAFInformation(), nullptr) << "a block shorter than its header is emptied";

    CTqovixAudioLevelInformationVisitor emptyLevel;
    emptyLevel.SetAudioLevelInformation(nullptr, 0);
    EXPECT_EQ(m_tree.Update(emptyLevel), eTqovixErrorInternal);
}

TEST_F(TagTreeTest, EmptyAndZeroSizedAfInformation)
{
    // An atom claiming size 0 cannot be parsed at all; an empty one gives a bare header.
    CTqovixFile file;
    CTqovixAtomControl tree;
    const std::string path = m_dir.File("zero.mov");
    Bytes zero = Atom("OP01", {});
    zero[3] = 0;
    ASSERT_TRUE(testsupport::WriteFile(path, MovieWith(kRate, {zero, Atom("OP02", {})})));
    ASSERT_EQ(file.Open(path.c_str(), 1), eTqovixSuccess);
    EXPECT_EQ(tree.Initialize(file), eTqovixErrorInvalidMovie);

    // Alone, an empty atom leaves "TCDB" too small to be a container: nothing is found.
    Load(MovieWith(kRate, {Atom("OP01", {})}));
    CTqovixAFInformationVisitor hidden;
    EXPECT_EQ(m_tree.Analyze(hidden), eTqovixErrorInvalidMovie);

    Load(MovieWith(kRate, {Atom("OP01", {}), Atom("OP02", {})}));
    CTqovixAFInformationVisitor af;
    ASSERT_EQ(m_tree.Analyze(af), eTqovixSuccess);
    ASSERT_EQ(af.GetAFInformationSize(), 8u);
    EXPECT_EQ(Bytes(af.GetAFInformation(), af.GetAFInformation() + 8), (Bytes{0, 0, 0, 8, 'O', 'P', '0', '1'}));
}

TEST_F(TagTreeTest, MakerBlocksElsewhereAreNotFound)
{
    // "OP02" directly under "TCDT" (no "TCDB") and no "OP01" at all.
    Bytes ftyp;
    moviekit::PutString(ftyp, "qt  ");
    Load(moviekit::Concat(
        {Atom("ftyp", ftyp),
         Container("moov", {Container("udta", {Container("TCDT", {Atom("OP02", Bytes(4, 1)), Atom("TCTG", kRate)})})})}));
    CTqovixAFInformationVisitor af;
    EXPECT_EQ(m_tree.Analyze(af), eTqovixErrorInvalidMovie);
    EXPECT_EQ(af.GetAFInformation(), nullptr);
    CTqovixAudioLevelInformationVisitor level;
    EXPECT_EQ(m_tree.Analyze(level), eTqovixErrorInvalidMovie);
    level.SetAudioLevelInformation(Bytes(12, 1).data(), 12);
    EXPECT_EQ(m_tree.Update(level), eTqovixVisitSkip);
}

}  // namespace

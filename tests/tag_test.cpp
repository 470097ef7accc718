#include <gtest/gtest.h>

#include <numeric>
#include <string>
#include <vector>

#include "ByteWriter.h"
#include "atom/CTqovixAtomControl.h"
#include "atom/CTqovixContainerAtom.h"
#include "atom/CTqovixTCTGAtom.h"
#include "file/CTqovixFile.h"
#include "support/TestSupport.h"
#include "visitor/CTqovixMakerBlockVisitor.h"
#include "visitor/CTqovixTCTGAtomVisitor.h"
#include "visitor/CTqovixTrimInformationVisitor.h"

using moviekit::Atom;
using moviekit::Bytes;
using moviekit::Concat;
using moviekit::Container;

namespace {

Bytes Tag(uint16_t group, uint16_t number, uint16_t type, uint16_t count, const Bytes& values)
{
    Bytes out;
    for (uint16_t field : {group, number, type, count}) {
        moviekit::PutU16(out, field);
    }
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

Bytes Ascii(const std::string& text) { return Bytes(text.c_str(), text.c_str() + text.size() + 1); }

const Bytes kForward = Tag(0, 20, 4, 2, Longs({12, 0}));
const Bytes kBackward = Tag(0, 21, 4, 2, Longs({7, 0}));
const Bytes kRate = Tag(0, 22, 5, 1, Longs({30000, 1001}));
const Bytes kSoftware = Tag(0, 3, 2, 19, Ascii("VELDA OVIX Utility"));

// A movie whose maker data holds the given tag payload and maker blocks.
Bytes MovieWith(const Bytes& tags, const std::vector<Bytes>& makerBlocks = {})
{
    return Concat({Atom("ftyp", Bytes{'q', 't', ' ', ' ', 0, 0, 0, 0}),
                   Container("moov", {Atom("mvhd", Bytes(100, 1)),
                                      Container("udta", {Container("TCDT", {Container("TCDB", makerBlocks),
                                                                            Atom("TCTG", tags)})})}),
                   Atom("mdat", Bytes(16, 2))});
}

Bytes BlockOf(const CTqovixAFInformationVisitor& af)
{
    const uint8_t* block = af.GetAFInformation();
    return block == nullptr ? Bytes{} : Bytes(block, block + af.GetAFInformationSize());
}

class TagTreeTest : public ::testing::Test {
protected:
    eTqovixErrorCode Load(const Bytes& movie)
    {
        m_tree.Close();
        m_file.Close();
        const std::string path = m_dir.File("movie" + std::to_string(m_loads++) + ".mov");
        EXPECT_TRUE(testsupport::WriteFile(path, movie));
        EXPECT_EQ(m_file.Open(path.c_str(), 1), eTqovixSuccess);
        return m_tree.Initialize(m_file);
    }

    // The payload of moov/udta/TCDT/TCTG as MovieWith lays it out.
    Bytes TagPayload()
    {
        TqovixAtomList atoms;
        m_tree.GetAtoms(atoms);
        const CTqovixAtom* atom = atoms.at(1).get();
        for (size_t index : {1, 0, 1}) {
            atom = dynamic_cast<const CTqovixContainerAtom&>(*atom).GetChildren().at(index).get();
        }
        EXPECT_EQ(atom->GetType(), TqovixAtom::kTCTG);
        const uint8_t* data = atom->GetData();
        return data == nullptr ? Bytes{} : Bytes(data, data + atom->GetDataSize());
    }

    testsupport::TempDir m_dir;
    CTqovixFile m_file;
    CTqovixAtomControl m_tree;
    int m_loads = 0;
};

TEST(TagCursorTest, WalksTagsAndReadsOnlyValuesThatFitThePayload)
{
    const Bytes payload = Concat({kRate, Tag(0, 3, 2, 19, Ascii("012345678901234567")), kForward});
    CTqovixTCTGAtom tags(payload.data(), payload.size());
    ASSERT_TRUE(tags.FindNextTag());
    EXPECT_EQ(tags.GetTagNumber(), 22);
    EXPECT_EQ(tags.GetTagSize(), 16u);
    std::vector<TCTG::TqovixURational> rationals;
    tags.GetTagData(rationals);
    ASSERT_EQ(rationals.size(), 1u);
    EXPECT_EQ(std::pair(rationals[0].numerator, rationals[0].denominator), std::pair(30000u, 1001u));
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

    // A count of 65535 LONGs in a 20-byte payload, and a header cut short.
    const Bytes runaway = Concat({kRate, Tag(0, 20, 4, 65535, Longs({1}))});
    CTqovixTCTGAtom runawayTags(runaway.data(), runaway.size());
    ASSERT_TRUE(runawayTags.FindNextTag());
    EXPECT_FALSE(runawayTags.FindNextTag());
    EXPECT_EQ(runawayTags.GetTagCount(), 0);
    runawayTags.GetTagData(longs);
    EXPECT_TRUE(longs.empty());
    const Bytes cut = Concat({kForward, Bytes{0, 0, 0, 21, 0}});
    CTqovixTCTGAtom cutTags(cut.data(), cut.size());
    ASSERT_TRUE(cutTags.FindNextTag());
    EXPECT_FALSE(cutTags.FindNextTag());
}

TEST_F(TagTreeTest, ReadsTheThreeTrimTags)
{
    const std::vector<uint32_t> all = {12, 7, 30000, 1001};
    const struct {
        const char* name;
        Bytes tags;
        std::vector<uint32_t> read;  // forward, backward, rate; none when refused
    } cases[] = {
        {"in order", Concat({kForward, kBackward, kRate}), all},
        {"any order among others",
         Concat({kSoftware, kRate, Tag(1, 20, 4, 2, Longs({5, 5})), kBackward, kForward}), all},
        {"forward with one value", Concat({Tag(0, 20, 4, 1, Longs({12})), kBackward, kRate}), {}},
        {"signed rational", Concat({kForward, kBackward, Tag(0, 22, 10, 1, Longs({30000, 1001}))}), {}},
        {"group one",
         Concat({Tag(1, 20, 4, 2, Longs({1, 0})), Tag(1, 21, 4, 2, Longs({1, 0})), Tag(1, 22, 5, 1, Longs({1, 1}))}),
         {}},
        {"forward twice, no backward", Concat({kForward, Tag(0, 20, 4, 2, Longs({3, 0})), kRate}), {3, 0, 30000, 1001}},
        // Tags behind the third acceptance are never read, even a broken one.
        {"stops after the third", Concat({kForward, kBackward, kRate, Tag(0, 20, 4, 65535, {})}), all},
        {"runaway count", Concat({kForward, Tag(0, 21, 4, 65535, Longs({1, 2}))}), {}},
        {"empty tag atom", {}, {}},
    };
    for (const auto& c : cases) {
        SCOPED_TRACE(c.name);
        ASSERT_EQ(Load(MovieWith(c.tags)), eTqovixSuccess);
        CTqovixTrimInformationVisitor v;
        EXPECT_EQ(m_tree.Analyze(v), c.read.empty() ? eTqovixErrorInvalidMovie : eTqovixSuccess);
        if (!c.read.empty()) {
            EXPECT_EQ((std::vector<uint32_t>{v.GetRemovedFrameForward(), v.GetRemovedFrameBackward(),
                                             v.GetFrameRateNumerator(), v.GetFrameRateDenominator()}),
                      c.read);
        }
        EXPECT_EQ(m_tree.Update(v), eTqovixErrorInternal) << "the trim visitor reads only";
    }
}

TEST_F(TagTreeTest, SoftwareNameReplacesTheFirstOldOneAndKeepsEverythingElse)
{
    const Bytes other = Tag(0, 1, 4, 1, Longs({42}));
    const Bytes foreignThree = Tag(1, 3, 2, 4, Ascii("abc"));
    const struct {
        Bytes before, after;
    } cases[] = {
        {Concat({other, Tag(0, 3, 2, 6, Ascii("Maker")), foreignThree}), Concat({other, kSoftware, foreignThree})},
        {Concat({other, Tag(0, 2, 3, 1, {0, 5})}), Concat({other, Tag(0, 2, 3, 1, {0, 5}), kSoftware})},
        {Concat({Tag(0, 3, 2, 2, Ascii("a")), other, Tag(0, 3, 2, 3, Ascii("bb")), foreignThree}),
         Concat({kSoftware, other, foreignThree})},
        {Tag(0, 3, 2, 2, Ascii("a")), kSoftware},
    };
    for (const auto& c : cases) {
        ASSERT_EQ(Load(MovieWith(c.before)), eTqovixSuccess);
        CTqovixTCTGAtomVisitor visitor;
        EXPECT_EQ(m_tree.Update(visitor), eTqovixSuccess);
        EXPECT_EQ(m_tree.Analyze(visitor), eTqovixErrorInternal) << "the software visitor only updates";
        EXPECT_EQ(TagPayload(), c.after);
        // The moov grows or shrinks with the tag atom.
        TqovixAtomList atoms;
        m_tree.GetAtoms(atoms);
        EXPECT_EQ(atoms[1]->GetSize(), MovieWith(c.after).size() - 16 - 24);
    }

    // An empty tag atom is left alone.
    ASSERT_EQ(Load(MovieWith({})), eTqovixSuccess);
    EXPECT_EQ(m_tree.Update(CTqovixTCTGAtomVisitor()), eTqovixVisitSkip);
    EXPECT_TRUE(TagPayload().empty());
}

TEST_F(TagTreeTest, MakerBlocksCopyOutWithHeaderGoBackAsPayloadAndMustBeInPlace)
{
    Bytes afPayload(100);
    std::iota(afPayload.begin(), afPayload.end(), uint8_t{7});
    ASSERT_EQ(Load(MovieWith(kRate, {Atom("OP01", afPayload), Atom("OP02", {'A', 'L', 'V', '1'})})), eTqovixSuccess);
    CTqovixAFInformationVisitor af;
    ASSERT_EQ(m_tree.Analyze(af), eTqovixSuccess);
    const Bytes block = BlockOf(af);
    EXPECT_EQ(block, Concat({Bytes{0, 0, 0, 0x6C, 'O', 'P', '0', '1'}, afPayload}));
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
    EXPECT_EQ(BlockOf(reread), processed);

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

    // An atom claiming size 0 cannot be parsed at all; an empty one gives a bare header.
    Bytes zero = Atom("OP01", {});
    zero[3] = 0;
    EXPECT_EQ(Load(MovieWith(kRate, {zero, Atom("OP02", {})})), eTqovixErrorInvalidMovie);
    ASSERT_EQ(Load(MovieWith(kRate, {Atom("OP01", {}), Atom("OP02", {})})), eTqovixSuccess);
    ASSERT_EQ(m_tree.Analyze(af), eTqovixSuccess);
    EXPECT_EQ(BlockOf(af), (Bytes{0, 0, 0, 8, 'O', 'P', '0', '1'}));

    // Alone, an empty atom leaves "TCDB" too small to be a container: nothing is found.
    ASSERT_EQ(Load(MovieWith(kRate, {Atom("OP01", {})})), eTqovixSuccess);
    EXPECT_EQ(m_tree.Analyze(af), eTqovixErrorInvalidMovie);

    // "OP02" directly under "TCDT" (no "TCDB") and no "OP01" at all.
    ASSERT_EQ(Load(Concat({Atom("ftyp", Bytes{'q', 't', ' ', ' '}),
                           Container("moov", {Container("udta", {Container("TCDT", {Atom("OP02", Bytes(4, 1)),
                                                                                     Atom("TCTG", kRate)})})})})),
              eTqovixSuccess);
    CTqovixAFInformationVisitor missing;
    EXPECT_EQ(m_tree.Analyze(missing), eTqovixErrorInvalidMovie);
    EXPECT_EQ(missing.GetAFInformation(), nullptr);
    EXPECT_EQ(m_tree.Analyze(level), eTqovixErrorInvalidMovie);
    level.SetAudioLevelInformation(Bytes(12, 1).data(), 12);
    EXPECT_EQ(m_tree.Update(level), eTqovixVisitSkip);
}

}  // namespace

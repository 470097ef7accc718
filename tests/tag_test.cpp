#include <gtest/gtest.h>

#include <ostream>
#include <string>
#include <vector>

#include "ByteWriter.h"
#include "MakerData.h"
#include "atom/CTqovixAtomControl.h"
#include "atom/CTqovixContainerAtom.h"
#include "file/CTqovixFile.h"
#include "support/TestSupport.h"
#include "support/TreeTest.h"
#include "visitor/CTqovixMakerBlockVisitor.h"
#include "visitor/CTqovixTCTGAtomVisitor.h"
#include "visitor/CTqovixTrimInformationVisitor.h"

using moviekit::Atom;
using moviekit::Bytes;
using moviekit::Concat;
using moviekit::Container;

namespace {

using testsupport::PrintTo;

// A tag of LONG values whose type and count may disagree with them.
Bytes Tag(uint16_t group, uint16_t number, uint16_t type, uint16_t count, const std::vector<uint32_t>& values)
{
    return moviekit::SerializeTag({group, number, type, count, moviekit::MakeLongTag(0, 0, values).data});
}

Bytes Name(uint16_t group, const std::string& text)
{
    return moviekit::SerializeTag(moviekit::MakeAsciiTag(group, moviekit::kSoftwareNameTag, text));
}

const Bytes kForward = Tag(0, 20, 4, 2, {12, 0});
const Bytes kBackward = Tag(0, 21, 4, 2, {7, 0});
const Bytes kRate = Tag(0, 22, 5, 1, {30000, 1001});
const Bytes kSoftware = Name(0, "VELDA OVIX Utility");

// A movie whose maker data holds the given tag payload and maker blocks.
Bytes MovieWith(const Bytes& tags, const std::vector<Bytes>& makerBlocks = {})
{
    const Bytes tcdt = Container("TCDT", {Container("TCDB", makerBlocks), Atom("TCTG", tags)});
    return Concat({Atom("ftyp", Bytes{'q', 't', ' ', ' '}), Container("moov", {Container("udta", {tcdt})})});
}

Bytes Copy(const uint8_t* data, uint64_t size) { return data == nullptr ? Bytes{} : Bytes(data, data + size); }

class TagTreeTest : public testsupport::TreeTest {
protected:
    // The payload of moov/udta/TCDT/TCTG as MovieWith lays it out.
    Bytes TagPayload()
    {
        TqovixAtomList atoms;
        m_tree.GetAtoms(atoms);
        const CTqovixAtom* atom = atoms.at(1).get();
        for (size_t index : {0, 0, 1}) {
            atom = dynamic_cast<const CTqovixContainerAtom&>(*atom).GetChildren().at(index).get();
        }
        EXPECT_EQ(atom->GetType(), TqovixAtom::kTCTG);
        return Copy(atom->GetData(), atom->GetDataSize());
    }
};

struct TrimRow {
    const char* name;
    Bytes (*tags)();
    std::vector<uint32_t> read;  // forward, backward, rate; none when refused
};

class TrimTagTest : public TagTreeTest, public ::testing::WithParamInterface<TrimRow> {};

TEST_P(TrimTagTest, ReadsTheThreeTrimTagsOrRefuses)
{
    const std::vector<uint32_t>& read = GetParam().read;
    ASSERT_EQ(Load(MovieWith(GetParam().tags())), eTqovixSuccess);
    CTqovixTrimInformationVisitor v;
    EXPECT_EQ(m_tree.Analyze(v), read.empty() ? eTqovixErrorInvalidMovie : eTqovixSuccess);
    if (!read.empty()) {
        EXPECT_EQ((std::vector<uint32_t>{v.GetRemovedFrameForward(), v.GetRemovedFrameBackward(),
                                         v.GetFrameRateNumerator(), v.GetFrameRateDenominator()}),
                  read);
    }
    EXPECT_EQ(m_tree.Update(v), eTqovixErrorInternal) << "the trim visitor reads only";
}

INSTANTIATE_TEST_SUITE_P(
    Trim, TrimTagTest,
    ::testing::Values(
        TrimRow{"ForwardWithOneValue", [] { return Concat({Tag(0, 20, 4, 1, {12}), kBackward, kRate}); }, {}},
        TrimRow{"SignedRational", [] { return Concat({kForward, kBackward, Tag(0, 22, 10, 1, {30000, 1001})}); }, {}},
        TrimRow{"GroupOne",
                [] { return Concat({Tag(1, 20, 4, 2, {1, 0}), Tag(1, 21, 4, 2, {1, 0}), Tag(1, 22, 5, 1, {1, 1})}); },
                {}},
        TrimRow{"ForwardTwiceNoBackward", [] { return Concat({kForward, Tag(0, 20, 4, 2, {3, 0}), kRate}); },
                {3, 0, 30000, 1001}},
        TrimRow{"CountPastThePayload", [] { return Concat({kForward, Tag(0, 21, 4, 65535, {1, 2})}); }, {}},
        // Tags behind the third acceptance are never read, even a broken one.
        TrimRow{"StopsAfterTheThird", [] { return Concat({kForward, kBackward, kRate, Tag(0, 20, 4, 65535, {})}); },
                {12, 7, 30000, 1001}}), testsupport::ByName);

TEST_F(TagTreeTest, SoftwareNameReplacesTheFirstOldOneAndKeepsEverythingElse)
{
    const Bytes other = Tag(0, 1, 4, 1, {42}), foreignThree = Name(1, "abc");
    const struct {
        Bytes before, after;
    } cases[] = {
        {other, Concat({other, kSoftware})},
        {Concat({Name(0, "a"), other, Name(0, "bb"), foreignThree}), Concat({kSoftware, other, foreignThree})},
    };
    for (const auto& c : cases) {
        ASSERT_EQ(Load(MovieWith(c.before)), eTqovixSuccess);
        CTqovixTCTGAtomVisitor visitor;
        EXPECT_EQ(m_tree.Update(visitor), eTqovixSuccess);
        EXPECT_EQ(m_tree.Analyze(visitor), eTqovixErrorInternal) << "the software visitor only updates";
        EXPECT_EQ(TagPayload(), c.after);
    }

    // An empty tag atom is left alone.
    ASSERT_EQ(Load(MovieWith({})), eTqovixSuccess);
    EXPECT_EQ(m_tree.Update(CTqovixTCTGAtomVisitor()), eTqovixVisitSkip);
    EXPECT_TRUE(TagPayload().empty());
}

TEST_F(TagTreeTest, MakerBlocksCopyOutWithAnEightByteHeaderAndMustBeInPlace)
{
    ASSERT_EQ(Load(MovieWith(kRate, {Atom("OP01", {}), Atom("OP02", {})})), eTqovixSuccess);
    CTqovixAFInformationVisitor af;
    const auto block = [&af] { return Copy(af.GetAFInformation(), af.GetAFInformationSize()); };
    ASSERT_EQ(m_tree.Analyze(af), eTqovixSuccess);
    EXPECT_EQ(block(), (Bytes{0, 0, 0, 8, 'O', 'P', '0', '1'}));

    // Going back only the payload is kept; a size field of 1 marks a 16-byte header (the
    // 64-bit size follows), any other an 8-byte one.
    Bytes wide(24, 0);
    wide[3] = 1;
    wide[20] = 0x5A;
    CTqovixAFInformationVisitor writer;
    writer.SetAFInformation(wide.data(), wide.size());
    EXPECT_EQ(m_tree.Update(writer), eTqovixSuccess);
    ASSERT_EQ(m_tree.Analyze(af), eTqovixSuccess);
    EXPECT_EQ(block(), (Bytes{0, 0, 0, 16, 'O', 'P', '0', '1', 0, 0, 0, 0, 0x5A, 0, 0, 0}));
    Bytes zeroSized(16, 0);
    zeroSized[12] = 0x5A;
    writer.SetAFInformation(zeroSized.data(), zeroSized.size());
    EXPECT_EQ(m_tree.Update(writer), eTqovixSuccess);
    ASSERT_EQ(m_tree.Analyze(af), eTqovixSuccess);
    EXPECT_EQ(block(), (Bytes{0, 0, 0, 16, 'O', 'P', '0', '1', 0, 0, 0, 0, 0x5A, 0, 0, 0})) << "size 0: 8-byte header";
    writer.SetAFInformation(wide.data(), 16);
    EXPECT_EQ(writer.GetAFInformation(), nullptr) << "a block no longer than its header is emptied";
    EXPECT_EQ(m_tree.Update(writer), eTqovixErrorInternal);

    // Blocks one level too deep are neither found nor replaced.
    const Bytes blocks = Concat({Atom("OP01", Bytes(4, 1)), Atom("OP02", Bytes(4, 1))});
    ASSERT_EQ(Load(MovieWith(kRate, {Atom("TCDB", blocks)})), eTqovixSuccess);
    CTqovixAFInformationVisitor missing;
    EXPECT_EQ(m_tree.Analyze(missing), eTqovixErrorInvalidMovie);
    EXPECT_EQ(missing.GetAFInformation(), nullptr);
    CTqovixAudioLevelInformationVisitor level;
    EXPECT_EQ(m_tree.Analyze(level), eTqovixErrorInvalidMovie);
    level.SetAudioLevelInformation(blocks.data(), blocks.size());
    EXPECT_EQ(m_tree.Update(level), eTqovixVisitSkip);
}

}  // namespace

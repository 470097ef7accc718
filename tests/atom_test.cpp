#include <gtest/gtest.h>

#include <functional>
#include <ostream>
#include <string>
#include <vector>

#include "ByteWriter.h"
#include "atom/CTqovixAtomControl.h"
#include "atom/CTqovixAtomVisitor.h"
#include "atom/CTqovixContainerAtom.h"
#include "atom/CTqovixLeafAtom.h"
#include "file/CTqovixFile.h"
#include "support/TestSupport.h"
#include "support/TreeTest.h"

using moviekit::Atom;
using moviekit::AtomOptions;
using moviekit::Bytes;
using moviekit::Concat;
using moviekit::Container;
using Path = TqovixAtomPath;

namespace {

using testsupport::PrintTo;

Bytes Ftyp(const std::string& brand) { return Atom("ftyp", Bytes(brand.begin(), brand.end())); }

// `depth` "moov" atoms one inside the other around an empty "free"; the innermost is too small to be a container.
Bytes Nested(int depth) { return depth == 0 ? Atom("free", {}) : Container("moov", {Nested(depth - 1)}); }

// Two tracks (the first with edits), a user data atom too short to be a container, and maker data.
Bytes SampleMovie()
{
    const Bytes media = Container("mdia", {Atom("mdhd", Bytes(24, 1)),
                                           Container("minf", {Container("stbl", {Atom("stsd", Bytes(16, 2)),
                                                                                 Atom("stco", Bytes(12, 3))})})});
    return Concat({Ftyp("qt  "), Atom("mdat", Bytes(300, 9)),
                   Container("moov", {Atom("mvhd", Bytes(100, 4)),
                                      Container("trak", {Atom("tkhd", Bytes(84, 5)),
                                                         Container("edts", {Atom("elst", Bytes(20, 6))}), media}),
                                      Container("trak", {Atom("tkhd", Bytes(84, 7)), media, Atom("free", {})}),
                                      Container("udta", {Atom("free", {})}),
                                      Container("udta", {Container("TCDT", {Atom("TCTG", Bytes(27, 8))})})})});
}

using AtomFileTest = testsupport::TreeTest;

// Records what a walk shows it and answers from a script keyed by path text.
struct RecordingVisitor : CTqovixAtomVisitor {
    // Leads into every container and passes over every leaf unless a test says otherwise.
    static eTqovixErrorCode Default(bool isLeaf) { return isLeaf ? eTqovixVisitSkip : eTqovixVisitContinue; }
    using Answer = std::function<eTqovixErrorCode(const std::string&, bool isLeaf)>;
    explicit RecordingVisitor(Answer a = [](const std::string&, bool isLeaf) { return Default(isLeaf); }) : answer(a) {}
    Answer answer;
    mutable std::vector<std::string> seen;

    eTqovixErrorCode Analyze(const Path& p, const CTqovixContainerAtom&) const override { return Record(p, false); }
    eTqovixErrorCode Update(const Path& p, CTqovixContainerAtom&) const override { return Record(p, false); }
    eTqovixErrorCode Analyze(const Path& p, const CTqovixLeafAtom&) const override { return Record(p, true); }
    eTqovixErrorCode Update(const Path& p, CTqovixLeafAtom&) const override { return Record(p, true); }
    void SetNeedAnalyzeMediaTime(bool need) const override { seen.push_back(need ? "edits:yes" : "edits:no"); }

    eTqovixErrorCode Record(const Path& path, bool isLeaf) const
    {
        std::string text;
        for (eTqovixAtomType type : path) {
            if (!text.empty()) {
                text += '/';
            }
            text += TqovixAtomTypeName(type);
        }
        seen.push_back(text);
        return answer(text, isLeaf);
    }
};

TEST_F(AtomFileTest, LeavesReadTheirPayloadOnceAndPickTheirHeaderAtTheThirtyTwoBitLimit)
{
    const auto stsd = TqovixMakeAtomPath("stsd")[0];
    CTqovixFile unopened;
    EXPECT_EQ(CTqovixLeafAtom(stsd, &unopened, 0, 4294967287ULL).GetSize(), 4294967295ULL);
    EXPECT_EQ(CTqovixLeafAtom(stsd, &unopened, 0, 4294967288ULL).GetSize(), 4294967304ULL);
    EXPECT_EQ(CTqovixLeafAtom(stsd, &unopened, 0, 100, true).GetSize(), 116u);

    TqovixAtomList children{std::make_shared<CTqovixLeafAtom>(stsd, &unopened, 0, 4294967288ULL - 16),
                            std::make_shared<CTqovixLeafAtom>(stsd, &unopened, 0, 0)};
    EXPECT_EQ(CTqovixContainerAtom(TqovixAtom::kMoov, children).GetSize(), 4294967304ULL);

    const Bytes payload = {1, 2, 3, 4, 5, 6, 7, 8, 9};
    const std::string path = Open(m_file, 1, Concat({Bytes(8, 0xEE), payload}));
    CTqovixLeafAtom leaf(TqovixAtom::kOP01, &m_file, 8, payload.size());
    const uint8_t* data = leaf.GetData();
    ASSERT_NE(data, nullptr);
    EXPECT_EQ(Bytes(data, data + payload.size()), payload);
    m_file.Close();
    ASSERT_EQ(leaf.GetData(), data) << "a second read comes from memory";

    // A payload claimed far beyond the file neither allocates nor reads.
    ASSERT_EQ(m_file.Open(path.c_str(), 1), eTqovixSuccess);
    CTqovixLeafAtom huge(TqovixAtom::kOP01, &m_file, 8, 4ULL << 30);
    EXPECT_EQ(huge.GetData(), nullptr);
    EXPECT_EQ(huge.LoadData(), eTqovixErrorInvalidMovie);
}

Bytes Qt(const Bytes& rest) { return Concat({Ftyp("qt  "), rest}); }
Bytes Sized(const char* type, uint32_t size, size_t payload)
{
    return Atom(type, Bytes(payload, 0), AtomOptions{.overrideSize = true, .sizeOverride = size});
}
Bytes SmallMoov() { return Container("moov", {Atom("mvhd", Bytes(20, 0))}); }

struct FileRow {
    const char* name;
    Bytes (*bytes)();
    bool accepted;
};

class AtomFileRowTest : public AtomFileTest, public ::testing::WithParamInterface<FileRow> {};

TEST_P(AtomFileRowTest, RefusedOrWrittenBackIdentical)
{
    ASSERT_EQ(Load(SampleMovie()), eTqovixSuccess);
    TqovixAtomList before, after;
    m_tree.GetAtoms(before);
    const Bytes bytes = GetParam().bytes();
    EXPECT_EQ(Load(bytes), GetParam().accepted ? eTqovixSuccess : eTqovixErrorInvalidMovie);
    m_tree.GetAtoms(after);
    // A refused file leaves the previous tree as it was.
    EXPECT_EQ(after == before, !GetParam().accepted);
    if (GetParam().accepted) {
        EXPECT_EQ(WriteTree(), bytes);
    }
}

INSTANTIATE_TEST_SUITE_P(
    Files, AtomFileRowTest,
    ::testing::Values(
        FileRow{"Mp42AfterMoov", [] { return Concat({SmallMoov(), Ftyp("mp42"), Atom("mdat", {})}); }, true},
        FileRow{"MoovWithA64BitSize",
                [] { return Qt(Container("moov", {Atom("mvhd", Bytes(20, 0))}, {.largeHeader = true})); }, true},
        FileRow{"DeepestNesting", [] { return Qt(Nested(CTqovixAtomControl::kMaxDepth + 1)); }, true},
        FileRow{"OneLevelDeeper", [] { return Qt(Nested(CTqovixAtomControl::kMaxDepth + 2)); }, false},
        FileRow{"OtherBrand", [] { return Concat({Ftyp("isom"), SmallMoov()}); }, false},
        FileRow{"NoFtyp", [] { return SmallMoov(); }, false},
        FileRow{"FtypPayloadOfThreeBytes", [] { return Concat({Atom("ftyp", {'q', 't', ' '}), SmallMoov()}); }, false},
        FileRow{"FtypOneByteOver1MiB",
                [] { return Concat({Ftyp("qt  " + std::string((1 << 20) - 3, ' ')), SmallMoov()}); }, false},
        FileRow{"EmptyFile", [] { return Bytes{}; }, false},
        FileRow{"TruncatedExtendedHeader", [] { return Qt({0, 0, 0, 1, 'm', 'd', 'a', 't', 0}); }, false},
        FileRow{"LastAtomClaimsEightMore", [] { return Qt(Sized("mdat", 24, 8)); }, false},
        FileRow{"SizeZero", [] { return Qt(Sized("mdat", 0, 8)); }, false},
        FileRow{"ExtendedSizeFifteen",
                [] { return Qt({0, 0, 0, 1, 'm', 'd', 'a', 't', 0, 0, 0, 0, 0, 0, 0, 15, 0, 0, 0, 0}); }, false},
        FileRow{"ChildRunsPastItsParent",
                [] { return Qt(Concat({Container("moov", {Sized("mvhd", 32, 20)}), Atom("free", {})})); }, false},
        FileRow{"ChildSmallerThanItsHeader", [] { return Qt(Container("moov", {Sized("mvhd", 4, 20)})); }, false},
        // With ftyp, one too many.
        FileRow{"MoreAtomsThanTheBound",
                [] { return Qt(Concat(std::vector<Bytes>(CTqovixAtomControl::kMaxAtoms, Atom("free", {})))); }, false}),
    testsupport::ByName);

TEST_F(AtomFileTest, WalksFollowTrackRulesAndTheVisitorsAnswers)
{
    ASSERT_EQ(Load(SampleMovie()), eTqovixSuccess);
    RecordingVisitor visitor;
    EXPECT_EQ(m_tree.Analyze(visitor), eTqovixErrorInvalidMovie) << "a walk nothing stopped found nothing";
    // Each track's media comes before its header and edits; the short user data is not entered.
    const std::string t = "moov/trak", stbl = t + "/mdia/minf/stbl";
    const std::vector<std::string> media = {t + "/mdia", t + "/mdia/mdhd", t + "/mdia/minf", stbl, stbl + "/stsd",
                                            stbl + "/stco", t + "/tkhd"};
    std::vector<std::string> expected = {"ftyp", "mdat", "moov", "moov/mvhd", t, "edits:yes"};
    expected.insert(expected.end(), media.begin(), media.end());
    expected.insert(expected.end(), {t + "/edts", t + "/edts/elst", t, "edits:no"});
    expected.insert(expected.end(), media.begin(), media.end());
    expected.insert(expected.end(), {t + "/free", "moov/udta", "moov/udta", "moov/udta/TCDT", "moov/udta/TCDT/TCTG"});
    EXPECT_EQ(visitor.seen, expected);

    // What the visitor answers steers and stops the walk.
    using V = RecordingVisitor;
    const auto atMvhd = [](eTqovixErrorCode code) {
        return [code](const std::string& p, bool leaf) { return p.ends_with("mvhd") ? code : V::Default(leaf); };
    };
    const struct {
        V::Answer answer;
        eTqovixErrorCode analyzeResult, updateResult;
        std::string lastSeen;
    } cases[] = {
        // Passing over "moov" hides everything below it.
        {[](const std::string& p, bool leaf) { return p == "moov" ? eTqovixVisitSkip : V::Default(leaf); },
         eTqovixErrorInvalidMovie, eTqovixVisitSkip, "moov"},
        // A leaf that has found what it wanted ends the walk with success; 155 from a leaf goes on.
        {[](const std::string& p, bool leaf) {
             return p.ends_with("stsd") ? eTqovixSuccess
                    : leaf && p != "ftyp" && p != "mdat" ? eTqovixVisitContinue
                                                         : V::Default(leaf);
         },
         eTqovixSuccess, eTqovixSuccess, "moov/trak/mdia/minf/stbl/stsd"},
        // Verdict codes pass through; other small codes read as success.
        {atMvhd(eTqovixVerdict9), eTqovixVerdict9, eTqovixVerdict9, "moov/mvhd"},
        {atMvhd(eTqovixNoAudioLevel), eTqovixSuccess, eTqovixSuccess, "moov/mvhd"},
        // A container's own answer other than 156 never stops the walk.
        {[](const std::string& p, bool leaf) { return leaf || p != "moov" ? eTqovixVisitSkip : eTqovixErrorInternal; },
         eTqovixErrorInvalidMovie, eTqovixVisitSkip, "moov/udta"},
    };
    for (const auto& c : cases) {
        V analyze(c.answer), steered(c.answer);
        EXPECT_EQ(m_tree.Analyze(analyze), c.analyzeResult);
        EXPECT_EQ(analyze.seen.back(), c.lastSeen);
        EXPECT_EQ(m_tree.Update(steered), c.updateResult);
    }

    // A tree never read walks nothing, and a closed file gives none.
    CTqovixAtomControl empty;
    EXPECT_EQ(empty.Analyze(visitor), eTqovixErrorGeneral);
    EXPECT_EQ(empty.Update(visitor), eTqovixErrorGeneral);
    CTqovixFile closed;
    EXPECT_EQ(empty.Initialize(closed), eTqovixErrorInternal);
}

}  // namespace

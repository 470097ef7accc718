#include <gtest/gtest.h>

#include <functional>
#include <string>
#include <vector>

#include "ByteWriter.h"
#include "atom/CTqovixAtomControl.h"
#include "atom/CTqovixAtomVisitor.h"
#include "atom/CTqovixContainerAtom.h"
#include "atom/CTqovixLeafAtom.h"
#include "file/CTqovixFile.h"
#include "support/TestSupport.h"

using moviekit::Atom;
using moviekit::AtomOptions;
using moviekit::Bytes;
using moviekit::Concat;
using moviekit::Container;
using Path = TqovixAtomPath;

namespace {

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

class AtomFileTest : public ::testing::Test {
protected:
    // A new name each time: a tree may still point into an earlier file.
    std::string Open(CTqovixFile& file, int mode, const Bytes& bytes = {})
    {
        const std::string path = m_dir.File(std::to_string(m_files++) + ".mov");
        file.Close();
        EXPECT_TRUE(mode == 2 || testsupport::WriteFile(path, bytes));
        EXPECT_EQ(file.Open(path.c_str(), mode), eTqovixSuccess);
        return path;
    }

    eTqovixErrorCode Parse(const Bytes& bytes)
    {
        Open(m_source, 1, bytes);
        return m_control.Initialize(m_source);
    }

    Bytes WriteBack()
    {
        TqovixAtomList atoms;
        m_control.GetAtoms(atoms);
        CTqovixFile out;
        const std::string path = Open(out, 2);
        for (const auto& atom : atoms) {
            EXPECT_EQ(atom->Write(out), eTqovixSuccess);
        }
        out.Close();
        return testsupport::ReadFile(path);
    }

    testsupport::TempDir m_dir;
    CTqovixFile m_source;
    CTqovixAtomControl m_control;
    int m_files = 0;
};

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
    const std::string path = Open(m_source, 1, Concat({Bytes(8, 0xEE), payload}));
    CTqovixLeafAtom leaf(TqovixAtom::kOP01, &m_source, 8, payload.size());
    const uint8_t* data = leaf.GetData();
    ASSERT_NE(data, nullptr);
    EXPECT_EQ(Bytes(data, data + payload.size()), payload);
    m_source.Close();
    ASSERT_EQ(leaf.GetData(), data) << "a second read comes from memory";

    // A payload claimed far beyond the file neither allocates nor reads.
    ASSERT_EQ(m_source.Open(path.c_str(), 1), eTqovixSuccess);
    CTqovixLeafAtom huge(TqovixAtom::kOP01, &m_source, 8, 4ULL << 30);
    EXPECT_EQ(huge.GetData(), nullptr);
    EXPECT_EQ(huge.LoadData(), eTqovixErrorInvalidMovie);
}

TEST_F(AtomFileTest, RefusesBrokenFilesAndWritesAcceptedOnesBackIdentical)
{
    const auto qt = [](const Bytes& rest) { return Concat({Ftyp("qt  "), rest}); };
    const auto sized = [](const char* type, uint32_t size, size_t payload) {
        return Atom(type, Bytes(payload, 0), AtomOptions{.overrideSize = true, .sizeOverride = size});
    };
    const Bytes moov = Container("moov", {Atom("mvhd", Bytes(20, 0))});
    const std::vector<Bytes> frees(CTqovixAtomControl::kMaxAtoms, Atom("free", {}));  // with ftyp, one too many
    const eTqovixErrorCode ok = eTqovixSuccess, bad = eTqovixErrorInvalidMovie;
    const struct {
        const char* name;
        Bytes bytes;
        eTqovixErrorCode expected;
    } cases[] = {
        {"mp42 after moov", Concat({moov, Ftyp("mp42"), Atom("mdat", {})}), ok},
        {"moov with a 64-bit size", qt(Container("moov", {Atom("mvhd", Bytes(20, 0))}, {.largeHeader = true})), ok},
        {"deepest nesting", qt(Nested(CTqovixAtomControl::kMaxDepth + 1)), ok},
        {"one level deeper", qt(Nested(CTqovixAtomControl::kMaxDepth + 2)), bad},
        {"other brand", Concat({Ftyp("isom"), moov}), bad},
        {"no ftyp", moov, bad},
        {"ftyp payload of three bytes", Concat({Atom("ftyp", {'q', 't', ' '}), moov}), bad},
        {"ftyp one byte over 1 MiB", Concat({Ftyp("qt  " + std::string((1 << 20) - 3, ' ')), moov}), bad},
        {"empty file", {}, bad},
        {"truncated extended header", qt({0, 0, 0, 1, 'm', 'd', 'a', 't', 0}), bad},
        {"last atom claims eight more", qt(sized("mdat", 24, 8)), bad},
        {"size zero", qt(sized("mdat", 0, 8)), bad},
        {"extended size fifteen", qt({0, 0, 0, 1, 'm', 'd', 'a', 't', 0, 0, 0, 0, 0, 0, 0, 15, 0, 0, 0, 0}), bad},
        {"child runs past its parent", qt(Concat({Container("moov", {sized("mvhd", 32, 20)}), Atom("free", {})})), bad},
        {"child smaller than its header", qt(Container("moov", {sized("mvhd", 4, 20)})), bad},
        {"more atoms than the bound", qt(Concat(frees)), bad},
    };
    CTqovixFile closed;
    EXPECT_EQ(m_control.Initialize(closed), eTqovixErrorInternal);
    TqovixAtomList before, after;
    for (const auto& c : cases) {
        SCOPED_TRACE(c.name);
        m_control.GetAtoms(before);
        EXPECT_EQ(Parse(c.bytes), c.expected);
        m_control.GetAtoms(after);
        // A refused file leaves the previous tree as it was.
        EXPECT_EQ(after == before, c.expected != ok);
        if (c.expected == ok) {
            EXPECT_EQ(WriteBack(), c.bytes);
        }
    }
}

TEST_F(AtomFileTest, WalksFollowTrackRulesAndTheVisitorsAnswers)
{
    ASSERT_EQ(Parse(SampleMovie()), eTqovixSuccess);
    RecordingVisitor visitor;
    EXPECT_EQ(m_control.Analyze(visitor), eTqovixErrorInvalidMovie) << "a walk nothing stopped found nothing";
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
        EXPECT_EQ(m_control.Analyze(analyze), c.analyzeResult);
        EXPECT_EQ(analyze.seen.back(), c.lastSeen);
        EXPECT_EQ(m_control.Update(steered), c.updateResult);
    }

    CTqovixAtomControl empty;
    EXPECT_EQ(empty.Analyze(visitor), eTqovixErrorGeneral);
    EXPECT_EQ(empty.Update(visitor), eTqovixErrorGeneral);
}

}  // namespace

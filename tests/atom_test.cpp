#include <gtest/gtest.h>

#include <algorithm>
#include <functional>
#include <string>
#include <vector>

#include "ByteWriter.h"
#include "Movie.h"
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

Bytes Filled(size_t size, uint8_t seed)
{
    Bytes bytes(size);
    for (size_t i = 0; i < size; ++i) {
        bytes[i] = static_cast<uint8_t>(seed + i * 7);
    }
    return bytes;
}

Bytes Ftyp(const std::string& brand, size_t padding = 0)
{
    Bytes payload;
    moviekit::PutString(payload, brand);
    moviekit::PutU32(payload, 0);
    moviekit::PutString(payload, "qt  ");
    moviekit::PutBytes(payload, Bytes(padding, 0));
    return Atom("ftyp", payload);
}

// ftyp, media data, and a moov with two tracks (the first with an edit list) and maker data.
Bytes SampleMovie()
{
    const Bytes media = Container("mdia", {Atom("mdhd", Filled(24, 1)),
                                           Container("minf", {Container("stbl", {Atom("stsd", Filled(16, 2)),
                                                                                 Atom("stco", Filled(12, 3))})})});
    return Concat({Ftyp("qt  "), Atom("mdat", Filled(300, 9)),
                   Container("moov", {Atom("mvhd", Filled(100, 4)),
                                      Container("trak", {Atom("tkhd", Filled(84, 5)),
                                                         Container("edts", {Atom("elst", Filled(20, 6))}), media}),
                                      Container("trak", {Atom("tkhd", Filled(84, 7)), media, Atom("free", {})}),
                                      Container("udta", {Container("TCDT", {Atom("TCTG", Filled(27, 8))})})})});
}

// `depth` "moov" containers one inside the other around an empty "free".
Bytes Nested(int depth)
{
    Bytes bytes;
    for (int i = 0; i < depth; ++i) {
        moviekit::PutU32(bytes, static_cast<uint32_t>(8 * (depth - i + 1)));
        moviekit::PutType(bytes, "moov");
    }
    moviekit::PutBytes(bytes, Atom("free", {}));
    return bytes;
}

class AtomFileTest : public ::testing::Test {
protected:
    // Every file gets a new name, so one that a tree still points into is never overwritten.
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
class RecordingVisitor : public CTqovixAtomVisitor {
public:
    // Leads into every container and passes over every leaf unless a test says otherwise.
    static eTqovixErrorCode Default(bool isLeaf) { return isLeaf ? eTqovixVisitSkip : eTqovixVisitContinue; }
    using Answer = std::function<eTqovixErrorCode(const std::string&, bool isLeaf)>;
    explicit RecordingVisitor(Answer a = [](const std::string&, bool isLeaf) { return Default(isLeaf); }) : answer(a) {}
    Answer answer;
    mutable std::vector<std::string> seen;

    size_t Count(const std::string& text) const { return std::count(seen.begin(), seen.end(), text); }
    eTqovixErrorCode Analyze(const Path& p, const CTqovixContainerAtom&) const override { return Record(p, false); }
    eTqovixErrorCode Update(const Path& p, CTqovixContainerAtom&) const override { return Record(p, false); }
    eTqovixErrorCode Analyze(const Path& p, const CTqovixLeafAtom&) const override { return Record(p, true); }
    eTqovixErrorCode Update(const Path& p, CTqovixLeafAtom&) const override { return Record(p, true); }
    void SetNeedAnalyzeMediaTime(bool need) const override { seen.push_back(need ? "edits:yes" : "edits:no"); }

private:
    eTqovixErrorCode Record(const Path& path, bool isLeaf) const
    {
        std::string text;
        for (eTqovixAtomType type : path) {
            text += (text.empty() ? "" : "/") + TqovixAtomTypeName(type);
        }
        seen.push_back(text);
        return answer(text, isLeaf);
    }
};

TEST_F(AtomFileTest, HeaderFormFollowsTheThirtyTwoBitLimitAndIsWrittenExactly)
{
    const auto stsd = TqovixMakeAtomPath("stsd")[0];
    // On-disk leaves report their size without being read.
    CTqovixFile unopened;
    EXPECT_EQ(CTqovixLeafAtom(stsd, &unopened, 0, 4294967287ULL).GetSize(), 4294967295ULL);
    EXPECT_EQ(CTqovixLeafAtom(stsd, &unopened, 0, 4294967288ULL).GetSize(), 4294967304ULL);
    EXPECT_EQ(CTqovixLeafAtom(stsd, &unopened, 0, 100, true).GetSize(), 116u);

    TqovixAtomList children{std::make_shared<CTqovixLeafAtom>(stsd, &unopened, 0, 4294967288ULL - 16),
                            std::make_shared<CTqovixLeafAtom>(stsd, &unopened, 0, 0)};
    EXPECT_EQ(CTqovixContainerAtom(TqovixAtom::kMoov, children).GetSize(), 4294967304ULL);
    EXPECT_EQ(CTqovixContainerAtom(TqovixAtom::kUdta, {}).GetSize(), 8u);

    CTqovixLeafAtom emptied(stsd, &unopened, 0, 50);
    emptied.SetData(nullptr, 0);
    EXPECT_EQ(emptied.GetSize(), 8u);
    EXPECT_EQ(emptied.GetData(), nullptr);
    EXPECT_FALSE(emptied.IsOnDisk());

    CTqovixFile out;
    const std::string path = Open(out, 2);
    CTqovixLeafAtom leaf(TqovixAtom::kTCTG, nullptr, 0, 0);
    const Bytes payload = Filled(100, 3);
    leaf.SetData(payload.data(), payload.size());
    ASSERT_EQ(leaf.Write(out), eTqovixSuccess);
    ASSERT_EQ(CTqovixContainerAtom(TqovixAtom::kUdta, {}).Write(out), eTqovixSuccess);
    auto inner = std::make_shared<CTqovixLeafAtom>(TqovixAtom::kOP01, nullptr, 0, 0);
    inner->SetData(payload.data(), 4);
    ASSERT_EQ(CTqovixContainerAtom(TqovixAtom::kTCDT, {inner}, true).Write(out), eTqovixSuccess);
    out.Close();

    const Bytes expected = Concat({Atom("TCTG", payload), Container("udta", {}),
                                   Container("TCDT", {Atom("OP01", Bytes(payload.begin(), payload.begin() + 4))},
                                             AtomOptions{.largeHeader = true})});
    EXPECT_EQ(testsupport::ReadFile(path), expected);

    CTqovixFile closed;
    EXPECT_EQ(leaf.Write(closed), eTqovixErrorInternal);
    EXPECT_EQ(CTqovixContainerAtom(TqovixAtom::kUdta, {}).Write(closed), eTqovixErrorInternal);
}

TEST_F(AtomFileTest, LeafPayloadIsReadOnceAndOnlyWithinTheFile)
{
    const Bytes payload = Filled(40, 5);
    const std::string path = Open(m_source, 1, Concat({Bytes(8, 0xEE), payload}));
    CTqovixLeafAtom leaf(TqovixAtom::kOP01, &m_source, 8, payload.size());
    ASSERT_TRUE(leaf.IsOnDisk());
    const uint8_t* data = leaf.GetData();
    ASSERT_NE(data, nullptr);
    EXPECT_EQ(Bytes(data, data + payload.size()), payload);
    EXPECT_FALSE(leaf.IsOnDisk());
    // A second read must come from memory: the file is gone by then.
    m_source.Close();
    ASSERT_EQ(leaf.GetData(), data);

    // A payload claimed far beyond the file neither allocates nor reads.
    ASSERT_EQ(m_source.Open(path.c_str(), 1), eTqovixSuccess);
    CTqovixLeafAtom huge(TqovixAtom::kOP01, &m_source, 8, 4ULL << 30);
    EXPECT_EQ(huge.GetData(), nullptr);
    EXPECT_EQ(huge.LoadData(), eTqovixErrorInvalidMovie);
    EXPECT_TRUE(huge.IsOnDisk());
    CTqovixFile out;
    Open(out, 2);
    EXPECT_EQ(huge.Write(out), eTqovixErrorInvalidMovie);
    long long written = -1;
    ASSERT_EQ(out.GetFileSize(&written), eTqovixSuccess);
    EXPECT_EQ(written, 0) << "a leaf that cannot be read must not leave a header behind";
}

TEST_F(AtomFileTest, ShortUserDataBecomesALeafAndLongerOneAContainer)
{
    ASSERT_EQ(Parse(Concat({Ftyp("mp42"), Container("moov", {Container("udta", {Atom("free", {})}),
                                                             Container("udta", {Atom("free", {0})})})})),
              eTqovixSuccess);
    TqovixAtomList atoms;
    m_control.GetAtoms(atoms);
    const auto& udtas = dynamic_cast<const CTqovixContainerAtom&>(*atoms[1]).GetChildren();
    ASSERT_EQ(udtas.size(), 2u);
    EXPECT_NE(dynamic_cast<const CTqovixLeafAtom*>(udtas[0].get()), nullptr);
    EXPECT_EQ(udtas[0]->GetDataSize(), 8u);
    EXPECT_NE(dynamic_cast<const CTqovixContainerAtom*>(udtas[1].get()), nullptr);
}

TEST_F(AtomFileTest, RefusesBrokenFilesAndWritesAcceptedOnesBackIdentical)
{
    const auto qt = [](const Bytes& rest) { return Concat({Ftyp("qt  "), rest}); };
    const auto sized = [](const char* type, uint32_t size, size_t payload) {
        return Atom(type, Bytes(payload, 0), AtomOptions{.overrideSize = true, .sizeOverride = size});
    };
    const auto extended = [&](uint64_t size, size_t payload) {
        return qt(Atom("mdat", Bytes(payload, 0),
                       AtomOptions{.largeHeader = true, .overrideSize = true, .sizeOverride = size}));
    };
    const Bytes moov = Container("moov", {Atom("mvhd", Filled(20, 0))});
    Bytes overrun = Container("moov", {Atom("mvhd", Filled(20, 0)), Atom("trak", Filled(20, 0))});
    overrun[8 + 28 + 3] += 4;  // the last child claims 4 bytes of whatever follows "moov"
    Bytes manyAtoms = Ftyp("qt  ");
    for (size_t i = 0; i <= CTqovixAtomControl::kMaxAtoms; ++i) {
        moviekit::PutBytes(manyAtoms, Atom("free", {}));
    }
    moviekit::MovieRecipe camera, wide, reordered;
    wide.largeMdatHeader = wide.co64 = true;
    wide.mdatCount = 2;
    wide.sound.codec = moviekit::SoundCodec::Aac;
    reordered.ftypAfterMoov = reordered.soundTrackFirst = true;
    reordered.majorBrand = "mp42";
    const eTqovixErrorCode bad = eTqovixErrorInvalidMovie;
    const struct {
        const char* name;
        Bytes bytes;
        eTqovixErrorCode expected;
    } cases[] = {
        {"other brand", Concat({Ftyp("isom"), Atom("moov", {})}), bad},
        {"qt brand", qt(Concat({moov, Atom("mdat", {})})), eTqovixSuccess},
        {"nesting depth of a camera movie", qt(Nested(12)), eTqovixSuccess},
        {"camera movie", moviekit::BuildMovie(camera), eTqovixSuccess},
        {"large mdat headers, co64 and AAC", moviekit::BuildMovie(wide), eTqovixSuccess},
        {"mp42 after moov, sound first", moviekit::BuildMovie(reordered), eTqovixSuccess},
        {"no ftyp", moov, bad},
        {"ftyp payload of three bytes", Concat({Atom("ftyp", {'q', 't', ' '}), Atom("moov", {})}), bad},
        {"huge ftyp", Concat({Ftyp("qt  ", 2 << 20), Container("moov", {Atom("mvhd", {})})}), bad},
        {"empty file", {}, bad},
        {"truncated header", qt({0, 0, 0}), bad},
        {"truncated extended header", qt({0, 0, 0, 1, 'm', 'd', 'a', 't', 0}), bad},
        {"last atom claims eight more", qt(sized("mdat", 24, 8)), bad},
        {"size zero", qt(sized("mdat", 0, 8)), bad},
        {"size seven", qt(sized("free", 7, 8)), bad},
        {"extended size zero", extended(0, 0), bad},
        {"extended size fifteen", extended(15, 8), bad},
        {"4 GiB leaf in 1 KiB", extended(4ULL << 30, 1000), bad},
        {"child runs past its parent", Concat({Ftyp("qt  "), overrun, Atom("free", Filled(8, 0))}), bad},
        {"child smaller than its header", qt(Container("moov", {sized("mvhd", 4, 20)})), bad},
        {"nesting depth in the thousands", qt(Nested(5000)), bad},
        {"more atoms than the bound", manyAtoms, bad},
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
        EXPECT_EQ(after == before, c.expected != eTqovixSuccess);
        if (c.expected == eTqovixSuccess) {
            EXPECT_EQ(WriteBack(), c.bytes) << "accepted files write back byte-identical";
        }
    }
}

TEST_F(AtomFileTest, WalksFollowTrackRulesAndTheVisitorsAnswers)
{
    ASSERT_EQ(Parse(SampleMovie()), eTqovixSuccess);
    RecordingVisitor visitor;
    EXPECT_EQ(m_control.Analyze(visitor), eTqovixErrorInvalidMovie) << "a walk nothing stopped found nothing";
    const std::string stbl = "moov/trak/mdia/minf/stbl";
    const std::vector<std::string> media = {"moov/trak/mdia", "moov/trak/mdia/mdhd", "moov/trak/mdia/minf", stbl,
                                            stbl + "/stsd", stbl + "/stco", "moov/trak/tkhd"};
    std::vector<std::string> expected = {"ftyp", "mdat", "moov", "moov/mvhd", "moov/trak", "edits:yes"};
    expected.insert(expected.end(), media.begin(), media.end());
    expected.insert(expected.end(), {"moov/trak/edts", "moov/trak/edts/elst", "moov/trak", "edits:no"});
    expected.insert(expected.end(), media.begin(), media.end());
    expected.insert(expected.end(), {"moov/trak/free", "moov/udta", "moov/udta/TCDT", "moov/udta/TCDT/TCTG"});
    EXPECT_EQ(visitor.seen, expected);

    // Updates keep file order, without the track rules.
    RecordingVisitor update([](const std::string& path, bool leaf) {
        return !leaf && (path == "moov" || path.starts_with("moov/trak")) ? eTqovixVisitContinue : eTqovixVisitSkip;
    });
    EXPECT_EQ(m_control.Update(update), eTqovixVisitSkip);
    EXPECT_EQ(std::vector<std::string>(update.seen.begin() + 5, update.seen.begin() + 13),
              (std::vector<std::string>{"moov/trak/tkhd", "moov/trak/edts", "moov/trak/edts/elst", "moov/trak/mdia",
                                        "moov/trak/mdia/mdhd", "moov/trak/mdia/minf", "moov/trak/mdia/minf/stbl",
                                        "moov/trak/mdia/minf/stbl/stsd"}));
    EXPECT_EQ(update.Count("edits:yes") + update.Count("edits:no"), 0u);
    EXPECT_EQ(update.Count("moov/udta"), 1u);
    EXPECT_EQ(update.Count("moov/udta/TCDT"), 0u);

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
        {atMvhd(eTqovixErrorInvalidMovie), eTqovixErrorInvalidMovie, eTqovixErrorInvalidMovie, "moov/mvhd"},
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

    V skipTracks(
        [](const std::string& p, bool leaf) { return p == "moov/trak" ? eTqovixVisitSkip : V::Default(leaf); });
    m_control.Analyze(skipTracks);
    EXPECT_EQ(skipTracks.Count("edits:yes") + skipTracks.Count("edits:no"), 0u);

    CTqovixAtomControl empty;
    EXPECT_EQ(empty.Analyze(visitor), eTqovixErrorGeneral);
    EXPECT_EQ(empty.Update(visitor), eTqovixErrorGeneral);
}

}  // namespace

#include <gtest/gtest.h>

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
using moviekit::Container;

namespace {

Bytes Filled(size_t size, uint8_t seed)
{
    Bytes bytes(size);
    for (size_t i = 0; i < size; ++i) {
        bytes[i] = static_cast<uint8_t>(seed + i * 7);
    }
    return bytes;
}

Bytes Ftyp(const std::string& brand)
{
    Bytes payload;
    moviekit::PutString(payload, brand);
    moviekit::PutU32(payload, 0);
    moviekit::PutString(payload, "qt  ");
    return Atom("ftyp", payload);
}

Bytes Track(const std::vector<Bytes>& beforeMedia, const std::vector<Bytes>& afterMedia)
{
    std::vector<Bytes> children = beforeMedia;
    children.push_back(Container(
        "mdia", {Atom("mdhd", Filled(24, 1)),
                 Container("minf", {Container("stbl", {Atom("stsd", Filled(16, 2)), Atom("stco", Filled(12, 3))})})}));
    children.insert(children.end(), afterMedia.begin(), afterMedia.end());
    return Container("trak", children);
}

// ftyp, a moov with two tracks (the first with an edit list) and maker data, and media data.
Bytes SampleMovie()
{
    return moviekit::Concat(
        {Ftyp("qt  "), Atom("mdat", Filled(300, 9)),
         Container("moov", {Atom("mvhd", Filled(100, 4)),
                            Track({Atom("tkhd", Filled(84, 5)), Container("edts", {Atom("elst", Filled(20, 6))})}, {}),
                            Track({Atom("tkhd", Filled(84, 7))}, {Atom("free", {})}),
                            Container("udta", {Container("TCDT", {Atom("TCTG", Filled(27, 8))})})})});
}

class AtomFileTest : public ::testing::Test {
protected:
    // Writes the bytes to a file and opens it for reading.
    void OpenSource(const Bytes& bytes)
    {
        m_sourcePath = m_dir.File("source.mov");
        ASSERT_TRUE(testsupport::WriteFile(m_sourcePath, bytes));
        ASSERT_EQ(m_source.Open(m_sourcePath.c_str(), 1), eTqovixSuccess);
    }

    eTqovixErrorCode Parse(const Bytes& bytes)
    {
        OpenSource(bytes);
        return m_control.Initialize(m_source);
    }

    testsupport::TempDir m_dir;
    std::string m_sourcePath;
    CTqovixFile m_source;
    CTqovixAtomControl m_control;
};

// Records what a walk shows it and answers from a script keyed by path text.
class RecordingVisitor : public CTqovixAtomVisitor {
public:
    // Leads into every container and passes over every leaf unless a test says otherwise.
    static eTqovixErrorCode Default(bool isLeaf) { return isLeaf ? eTqovixVisitSkip : eTqovixVisitContinue; }
    std::function<eTqovixErrorCode(const std::string&, bool isLeaf)> answer = [](const std::string&, bool isLeaf) {
        return Default(isLeaf);
    };
    mutable std::vector<std::string> seen;

    static std::string Text(const TqovixAtomPath& path)
    {
        std::string text;
        for (eTqovixAtomType type : path) {
            text += (text.empty() ? "" : "/") + TqovixAtomTypeName(type);
        }
        return text;
    }

    eTqovixErrorCode Analyze(const TqovixAtomPath& path, const CTqovixContainerAtom&) const override
    {
        return Record(path, false);
    }
    eTqovixErrorCode Update(const TqovixAtomPath& path, CTqovixContainerAtom&) const override
    {
        return Record(path, false);
    }
    eTqovixErrorCode Analyze(const TqovixAtomPath& path, const CTqovixLeafAtom&) const override
    {
        return Record(path, true);
    }
    eTqovixErrorCode Update(const TqovixAtomPath& path, CTqovixLeafAtom&) const override { return Record(path, true); }
    void SetNeedAnalyzeMediaTime(bool need) const override { seen.push_back(need ? "media-time:yes" : "media-time:no"); }

private:
    eTqovixErrorCode Record(const TqovixAtomPath& path, bool isLeaf) const
    {
        const std::string text = Text(path);
        seen.push_back(text);
        return answer(text, isLeaf);
    }
};

TEST(AtomSizeTest, HeaderFormFollowsTheThirtyTwoBitLimit)
{
    const auto stsd = TqovixMakeAtomPath("stsd")[0];
    CTqovixLeafAtom small(stsd, nullptr, 0, 0);
    small.SetData(Filled(100, 0).data(), 100);
    EXPECT_EQ(small.GetSize(), 108u);

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
}

TEST_F(AtomFileTest, WritesHeadersPayloadsAndTypeBytesExactly)
{
    CTqovixFile out;
    const std::string path = m_dir.File("out.bin");
    ASSERT_EQ(out.Open(path.c_str(), 2), eTqovixSuccess);

    CTqovixLeafAtom leaf(TqovixAtom::kTCTG, nullptr, 0, 0);
    const Bytes payload = Filled(100, 3);
    leaf.SetData(payload.data(), payload.size());
    ASSERT_EQ(leaf.Write(out), eTqovixSuccess);
    ASSERT_EQ(CTqovixContainerAtom(TqovixAtom::kUdta, {}).Write(out), eTqovixSuccess);
    auto inner = std::make_shared<CTqovixLeafAtom>(TqovixAtom::kOP01, nullptr, 0, 0);
    inner->SetData(payload.data(), 4);
    ASSERT_EQ(CTqovixContainerAtom(TqovixAtom::kTCDT, {inner}, true).Write(out), eTqovixSuccess);
    out.Close();

    Bytes expected = Atom("TCTG", payload);
    moviekit::PutBytes(expected, Container("udta", {}));
    moviekit::PutBytes(expected, Container("TCDT", {Atom("OP01", Bytes(payload.begin(), payload.begin() + 4))},
                                           AtomOptions{.largeHeader = true}));
    EXPECT_EQ(testsupport::ReadFile(path), expected);
    EXPECT_EQ(Bytes(expected.begin(), expected.begin() + 8), (Bytes{0, 0, 0, 108, 'T', 'C', 'T', 'G'}));

    CTqovixFile closed;
    EXPECT_EQ(leaf.Write(closed), eTqovixErrorInternal);
    EXPECT_EQ(CTqovixContainerAtom(TqovixAtom::kUdta, {}).Write(closed), eTqovixErrorInternal);
}

TEST_F(AtomFileTest, LeafPayloadIsReadOnceAndOnlyWithinTheFile)
{
    const Bytes payload = Filled(40, 5);
    OpenSource(moviekit::Concat({Bytes(8, 0xEE), payload}));

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
    ASSERT_EQ(m_source.Open(m_sourcePath.c_str(), 1), eTqovixSuccess);
    CTqovixLeafAtom huge(TqovixAtom::kOP01, &m_source, 8, 4ULL << 30);
    EXPECT_EQ(huge.GetData(), nullptr);
    EXPECT_EQ(huge.LoadData(), eTqovixErrorInvalidMovie);
    EXPECT_TRUE(huge.IsOnDisk());
    CTqovixFile out;
    ASSERT_EQ(out.Open(m_dir.File("out.bin").c_str(), 2), eTqovixSuccess);
    EXPECT_EQ(huge.Write(out), eTqovixErrorInvalidMovie);
    long long written = -1;
    ASSERT_EQ(out.GetFileSize(&written), eTqovixSuccess);
    EXPECT_EQ(written, 0) << "a leaf that cannot be read must not leave a header behind";
}

TEST_F(AtomFileTest, CameraMoviesWriteBackByteIdentical)
{
    moviekit::MovieSpec plain;
    moviekit::MovieSpec wide = plain;
    wide.largeMdatHeader = true;
    wide.co64 = true;
    wide.mdatCount = 2;
    wide.sound.codec = moviekit::SoundCodec::Aac;
    moviekit::MovieSpec reordered = plain;
    reordered.ftypAfterMoov = true;
    reordered.majorBrand = "mp42";
    reordered.soundTrackFirst = true;
    for (const moviekit::MovieSpec& recipe : {plain, wide, reordered}) {
        std::string error;
        const Bytes movie = moviekit::BuildMovie(recipe, nullptr, &error);
        ASSERT_FALSE(movie.empty()) << error;
        CTqovixFile source;
        CTqovixAtomControl tree;
        const std::string sourcePath = m_dir.File("camera.mov");
        ASSERT_TRUE(testsupport::WriteFile(sourcePath, movie));
        ASSERT_EQ(source.Open(sourcePath.c_str(), 1), eTqovixSuccess);
        ASSERT_EQ(tree.Initialize(source), eTqovixSuccess);

        TqovixAtomList atoms;
        tree.GetAtoms(atoms);
        CTqovixFile out;
        const std::string path = m_dir.File("copy.mov");
        ASSERT_EQ(out.Open(path.c_str(), 2), eTqovixSuccess);
        for (const auto& atom : atoms) {
            ASSERT_EQ(atom->Write(out), eTqovixSuccess);
        }
        out.Close();
        EXPECT_EQ(testsupport::ReadFile(path), movie);
    }
}

TEST_F(AtomFileTest, ShortUserDataBecomesALeafAndLongerOneAContainer)
{
    const Bytes movie = moviekit::Concat(
        {Ftyp("mp42"), Container("moov", {Container("udta", {Atom("free", {})}),
                                          Container("udta", {Atom("free", {0})})})});
    ASSERT_EQ(Parse(movie), eTqovixSuccess);
    TqovixAtomList atoms;
    m_control.GetAtoms(atoms);
    const auto& moov = dynamic_cast<const CTqovixContainerAtom&>(*atoms[1]);
    ASSERT_EQ(moov.GetChildren().size(), 2u);
    const auto* shortUdta = dynamic_cast<const CTqovixLeafAtom*>(moov.GetChildren()[0].get());
    ASSERT_NE(shortUdta, nullptr);
    EXPECT_EQ(shortUdta->GetDataSize(), 8u);
    EXPECT_NE(dynamic_cast<const CTqovixContainerAtom*>(moov.GetChildren()[1].get()), nullptr);
}

struct ParseCase {
    const char* name;
    std::function<Bytes()> bytes;
    eTqovixErrorCode expected;
};

void PrintTo(const ParseCase& c, std::ostream* os) { *os << c.name; }


Bytes WithSize(const char* type, uint32_t sizeField, size_t payloadBytes)
{
    return Atom(type, Bytes(payloadBytes, 0), AtomOptions{.overrideSize = true, .sizeOverride = sizeField});
}

Bytes WithExtendedSize(const char* type, uint64_t size, size_t payloadBytes)
{
    return Atom(type, Bytes(payloadBytes, 0), AtomOptions{.largeHeader = true, .overrideSize = true, .sizeOverride = size});
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

const ParseCase kParseCases[] = {
    {"QuickTimeBrand", [] { return moviekit::Concat({Ftyp("qt  "), Container("moov", {Atom("mvhd", Filled(20, 0))}), Atom("mdat", {})}); },
     eTqovixSuccess},
    {"Mp42BrandAfterMoov", [] { return moviekit::Concat({Container("moov", {Atom("mvhd", Filled(20, 0))}), Ftyp("mp42")}); }, eTqovixSuccess},
    {"OtherBrand", [] { return moviekit::Concat({Ftyp("isom"), Atom("moov", {})}); }, eTqovixErrorInvalidMovie},
    {"NoFtyp", [] { return Container("moov", {Atom("mvhd", Filled(20, 0))}); }, eTqovixErrorInvalidMovie},
    {"FtypPayloadOfThreeBytes", [] { return moviekit::Concat({Atom("ftyp", {'q', 't', ' '}), Atom("moov", {})}); },
     eTqovixErrorInvalidMovie},
    {"HugeFileTypeAtom",
     [] {
         Bytes ftyp = Ftyp("qt  ");
         moviekit::PutBytes(ftyp, Bytes(2 << 20, 0));
         ftyp[1] = static_cast<uint8_t>(ftyp.size() >> 16);
         ftyp[2] = static_cast<uint8_t>(ftyp.size() >> 8);
         ftyp[3] = static_cast<uint8_t>(ftyp.size());
         return moviekit::Concat({ftyp, Container("moov", {Atom("mvhd", {})})});
     },
     eTqovixErrorInvalidMovie},
    {"EmptyFile", [] { return Bytes{}; }, eTqovixErrorInvalidMovie},
    {"TruncatedHeader", [] { return moviekit::Concat({Ftyp("qt  "), Bytes{0, 0, 0}}); }, eTqovixErrorInvalidMovie},
    {"TruncatedExtendedHeader", [] { return moviekit::Concat({Ftyp("qt  "), Bytes{0, 0, 0, 1, 'm', 'd', 'a', 't', 0}}); },
     eTqovixErrorInvalidMovie},
    {"LastAtomClaimsEightMore", [] { return moviekit::Concat({Ftyp("qt  "), WithSize("mdat", 24, 8)}); },
     eTqovixErrorInvalidMovie},
    {"SizeZero", [] { return moviekit::Concat({Ftyp("qt  "), WithSize("mdat", 0, 8)}); }, eTqovixErrorInvalidMovie},
    {"SizeTwo", [] { return moviekit::Concat({Ftyp("qt  "), WithSize("free", 2, 8)}); }, eTqovixErrorInvalidMovie},
    {"SizeSeven", [] { return moviekit::Concat({Ftyp("qt  "), WithSize("free", 7, 8)}); }, eTqovixErrorInvalidMovie},
    {"ExtendedSizeZero", [] { return moviekit::Concat({Ftyp("qt  "), WithExtendedSize("mdat", 0, 0)}); },
     eTqovixErrorInvalidMovie},
    {"ExtendedSizeEight", [] { return moviekit::Concat({Ftyp("qt  "), WithExtendedSize("mdat", 8, 0)}); },
     eTqovixErrorInvalidMovie},
    {"ExtendedSizeFifteen", [] { return moviekit::Concat({Ftyp("qt  "), WithExtendedSize("mdat", 15, 8)}); },
     eTqovixErrorInvalidMovie},
    {"ExtendedSizeBeyondFile", [] { return moviekit::Concat({Ftyp("qt  "), WithExtendedSize("mdat", 1ULL << 40, 16)}); },
     eTqovixErrorInvalidMovie},
    {"FourGiBLeafInOneKiB", [] { return moviekit::Concat({Ftyp("qt  "), WithExtendedSize("mdat", 4ULL << 30, 1000)}); },
     eTqovixErrorInvalidMovie},
    {"ChildRunsPastParent",
     [] {
         Bytes moov = Container("moov", {Atom("mvhd", Filled(20, 0)), Atom("trak", Filled(20, 0))});
         moov[8 + 28 + 3] += 4;  // the last child claims 4 bytes of whatever follows "moov"
         return moviekit::Concat({Ftyp("qt  "), moov, Atom("free", Filled(8, 0))});
     },
     eTqovixErrorInvalidMovie},
    {"ChildSmallerThanItsHeader",
     [] { return moviekit::Concat({Ftyp("qt  "), Container("moov", {WithSize("mvhd", 4, 20)})}); },
     eTqovixErrorInvalidMovie},
    {"NestingDepthInTheThousands", [] { return moviekit::Concat({Ftyp("qt  "), Nested(5000)}); },
     eTqovixErrorInvalidMovie},
    {"NestingDepthOfACameraMovie", [] { return moviekit::Concat({Ftyp("qt  "), Nested(12)}); }, eTqovixSuccess},
    {"MillionsOfEmptyAtoms",
     [] {
         Bytes bytes = Ftyp("qt  ");
         for (size_t i = 0; i <= CTqovixAtomControl::kMaxAtoms; ++i) {
             moviekit::PutBytes(bytes, Atom("free", {}));
         }
         return bytes;
     },
     eTqovixErrorInvalidMovie},
};

class AtomParseTest : public AtomFileTest, public ::testing::WithParamInterface<ParseCase> {};

TEST_P(AtomParseTest, AcceptsOrRefusesWithTheExpectedCode)
{
    EXPECT_EQ(Parse(GetParam().bytes()), GetParam().expected);
    EXPECT_EQ(m_control.IsInitialized(), GetParam().expected == eTqovixSuccess);
}

INSTANTIATE_TEST_SUITE_P(Movies, AtomParseTest, ::testing::ValuesIn(kParseCases),
                         [](const ::testing::TestParamInfo<ParseCase>& info) { return std::string(info.param.name); });

TEST_F(AtomFileTest, FailedInitializeKeepsThePreviousTreeAndClosedFileIsRefused)
{
    CTqovixFile closed;
    EXPECT_EQ(m_control.Initialize(closed), eTqovixErrorInternal);
    ASSERT_EQ(Parse(SampleMovie()), eTqovixSuccess);

    CTqovixFile other;
    const std::string path = m_dir.File("bad.mov");
    ASSERT_TRUE(testsupport::WriteFile(path, Ftyp("isom")));
    ASSERT_EQ(other.Open(path.c_str(), 1), eTqovixSuccess);
    EXPECT_EQ(m_control.Initialize(other), eTqovixErrorInvalidMovie);
    TqovixAtomList atoms;
    m_control.GetAtoms(atoms);
    EXPECT_EQ(atoms.size(), 3u);
    m_control.Close();
    EXPECT_FALSE(m_control.IsInitialized());
}

TEST_F(AtomFileTest, AnalyzeWalkVisitsMediaFirstAndTellsAboutEditLists)
{
    ASSERT_EQ(Parse(SampleMovie()), eTqovixSuccess);
    RecordingVisitor visitor;
    EXPECT_EQ(m_control.Analyze(visitor), eTqovixErrorInvalidMovie) << "a walk nothing stopped found nothing";

    const std::vector<std::string> expected = {
        "ftyp", "mdat", "moov", "moov/mvhd",
        "moov/trak", "media-time:yes", "moov/trak/mdia", "moov/trak/mdia/mdhd", "moov/trak/mdia/minf",
        "moov/trak/mdia/minf/stbl", "moov/trak/mdia/minf/stbl/stsd", "moov/trak/mdia/minf/stbl/stco",
        "moov/trak/tkhd", "moov/trak/edts", "moov/trak/edts/elst",
        "moov/trak", "media-time:no", "moov/trak/mdia", "moov/trak/mdia/mdhd", "moov/trak/mdia/minf",
        "moov/trak/mdia/minf/stbl", "moov/trak/mdia/minf/stbl/stsd", "moov/trak/mdia/minf/stbl/stco",
        "moov/trak/tkhd", "moov/trak/free",
        "moov/udta", "moov/udta/TCDT", "moov/udta/TCDT/TCTG"};
    EXPECT_EQ(visitor.seen, expected);
}

TEST_F(AtomFileTest, UpdateWalkKeepsFileOrderWithoutTrackRules)
{
    ASSERT_EQ(Parse(SampleMovie()), eTqovixSuccess);
    RecordingVisitor visitor;
    visitor.answer = [](const std::string& path, bool leaf) {
        return !leaf && (path == "moov" || path.starts_with("moov/trak")) ? eTqovixVisitContinue : eTqovixVisitSkip;
    };
    EXPECT_EQ(m_control.Update(visitor), eTqovixVisitSkip);
    const std::vector<std::string> firstTrack(visitor.seen.begin() + 5, visitor.seen.begin() + 13);
    EXPECT_EQ(firstTrack, (std::vector<std::string>{
                              "moov/trak/tkhd", "moov/trak/edts", "moov/trak/edts/elst", "moov/trak/mdia",
                              "moov/trak/mdia/mdhd", "moov/trak/mdia/minf", "moov/trak/mdia/minf/stbl",
                              "moov/trak/mdia/minf/stbl/stsd"}));
    EXPECT_EQ(std::count(visitor.seen.begin(), visitor.seen.end(), "moov/udta"), 1);
    EXPECT_EQ(std::count(visitor.seen.begin(), visitor.seen.end(), "moov/udta/TCDT"), 0);
}

TEST_F(AtomFileTest, VisitorAnswersSteerAndStopTheWalk)
{
    ASSERT_EQ(Parse(SampleMovie()), eTqovixSuccess);
    struct Case {
        std::function<eTqovixErrorCode(const std::string&, bool)> answer;
        eTqovixErrorCode analyzeResult;
        eTqovixErrorCode updateResult;
        std::string lastSeen;
    };
    using V = RecordingVisitor;
    const Case cases[] = {
        // Passing over "moov" hides everything below it.
        {[](const std::string& p, bool leaf) { return p == "moov" ? eTqovixVisitSkip : V::Default(leaf); },
         eTqovixErrorInvalidMovie, eTqovixVisitSkip, "moov"},
        // A leaf that has found what it wanted ends the walk with success; 155 from a leaf goes on.
        {[](const std::string& p, bool leaf) {
             return p.ends_with("stsd") ? eTqovixSuccess : leaf && p != "ftyp" && p != "mdat" ? eTqovixVisitContinue
                                                                                           : V::Default(leaf);
         },
         eTqovixSuccess, eTqovixSuccess, "moov/trak/mdia/minf/stbl/stsd"},
        {[](const std::string& p, bool leaf) { return p.ends_with("mvhd") ? eTqovixErrorInvalidMovie : V::Default(leaf); },
         eTqovixErrorInvalidMovie, eTqovixErrorInvalidMovie, "moov/mvhd"},
        // Verdict codes pass through; other small codes read as success.
        {[](const std::string& p, bool leaf) { return p.ends_with("mvhd") ? eTqovixVerdict9 : V::Default(leaf); },
         eTqovixVerdict9, eTqovixVerdict9, "moov/mvhd"},
        {[](const std::string& p, bool leaf) { return p.ends_with("mvhd") ? eTqovixNoAudioLevel : V::Default(leaf); },
         eTqovixSuccess, eTqovixSuccess, "moov/mvhd"},
        // A container's own answer other than 156 never stops the walk.
        {[](const std::string& p, bool leaf) { return leaf || p != "moov" ? eTqovixVisitSkip : eTqovixErrorInternal; },
         eTqovixErrorInvalidMovie, eTqovixVisitSkip, "moov/udta"},
    };
    for (const Case& c : cases) {
        RecordingVisitor analyze;
        analyze.answer = c.answer;
        EXPECT_EQ(m_control.Analyze(analyze), c.analyzeResult);
        EXPECT_EQ(analyze.seen.back(), c.lastSeen);
        RecordingVisitor update;
        update.answer = c.answer;
        EXPECT_EQ(m_control.Update(update), c.updateResult);
    }

    RecordingVisitor skipTracks;
    skipTracks.answer = [](const std::string& p, bool leaf) {
        return p == "moov/trak" ? eTqovixVisitSkip : RecordingVisitor::Default(leaf);
    };
    m_control.Analyze(skipTracks);
    EXPECT_EQ(std::count(skipTracks.seen.begin(), skipTracks.seen.end(), "media-time:yes") +
                  std::count(skipTracks.seen.begin(), skipTracks.seen.end(), "media-time:no"),
              0);

    CTqovixAtomControl empty;
    RecordingVisitor visitor;
    EXPECT_EQ(empty.Analyze(visitor), eTqovixErrorGeneral);
    EXPECT_EQ(empty.Update(visitor), eTqovixErrorGeneral);
}

}  // namespace

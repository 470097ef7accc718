#include "MoovBuilder.h"

#include "SampleTables.h"

#include <algorithm>

namespace moviekit {

namespace {

constexpr uint32_t kVideoTrackId = 1;
constexpr uint32_t kSoundTrackId = 2;

uint32_t Clamp32(uint64_t value) { return static_cast<uint32_t>(std::min<uint64_t>(value, UINT32_MAX)); }

uint32_t Rescale(uint64_t value, uint32_t from, uint32_t to)
{
    return Clamp32(static_cast<uint64_t>(static_cast<unsigned __int128>(value) * to / from));
}

void PutMatrix(Bytes& out)
{
    for (uint32_t value : {0x00010000U, 0U, 0U, 0U, 0x00010000U, 0U, 0U, 0U, 0x40000000U}) {
        PutU32(out, value);
    }
}

Bytes Mvhd(uint32_t timeScale, uint32_t duration)
{
    Bytes p;
    PutU32(p, 0);  // version, flags
    PutU32(p, 0);  // creation time
    PutU32(p, 0);  // modification time
    PutU32(p, timeScale);
    PutU32(p, duration);
    PutU32(p, 0x00010000);  // preferred rate
    PutU16(p, 0x0100);      // preferred volume
    p.insert(p.end(), 10, 0);
    PutMatrix(p);
    p.insert(p.end(), 24, 0);  // preview, poster, selection, current time
    PutU32(p, kSoundTrackId + 1);
    return Atom("mvhd", p);
}

Bytes Tkhd(uint32_t trackId, uint32_t duration, bool sound, uint16_t width, uint16_t height)
{
    Bytes p;
    PutU32(p, 0x00000003);  // enabled, in movie
    PutU32(p, 0);
    PutU32(p, 0);
    PutU32(p, trackId);
    PutU32(p, 0);
    PutU32(p, duration);
    p.insert(p.end(), 8, 0);
    PutU16(p, 0);  // layer
    PutU16(p, 0);  // alternate group
    PutU16(p, sound ? 0x0100 : 0);
    PutU16(p, 0);
    PutMatrix(p);
    PutU32(p, uint32_t{width} << 16);
    PutU32(p, uint32_t{height} << 16);
    return Atom("tkhd", p);
}

Bytes Edts(uint32_t segmentDuration, uint32_t mediaTime, bool withElst)
{
    if (!withElst) {
        return Container("edts", {});
    }
    Bytes p;
    PutU32(p, 0);
    PutU32(p, 1);
    PutU32(p, segmentDuration);
    PutU32(p, mediaTime);
    PutU32(p, 0x00010000);
    return Container("edts", {Atom("elst", p)});
}

Bytes Mdhd(uint32_t timeScale, uint32_t duration)
{
    Bytes p;
    PutU32(p, 0);
    PutU32(p, 0);
    PutU32(p, 0);
    PutU32(p, timeScale);
    PutU32(p, duration);
    PutU16(p, 0);  // language
    PutU16(p, 0);  // quality
    return Atom("mdhd", p);
}

Bytes Hdlr(std::string_view componentType, std::string_view subtype, std::string_view name)
{
    Bytes p;
    PutU32(p, 0);
    PutType(p, componentType);
    PutType(p, subtype);
    PutU32(p, 0);  // manufacturer
    PutU32(p, 0);  // flags
    PutU32(p, 0);  // flags mask
    PutU8(p, static_cast<uint8_t>(name.size()));
    PutString(p, name);
    return Atom("hdlr", p);
}

Bytes Dinf()
{
    Bytes dref;
    PutU32(dref, 0);
    PutU32(dref, 1);
    Bytes self;
    PutU32(self, 1);  // flags: the data is in this file
    PutBytes(dref, Atom("alis", self));
    return Container("dinf", {Atom("dref", dref)});
}

Bytes VideoTrack(const MovieRecipe& recipe, const MoviePlan& plan, bool co64)
{
    const VideoRecipe& video = recipe.video;
    const uint64_t mediaDuration = uint64_t{video.frameCount} * video.frameDuration;
    const uint32_t movieDuration = Rescale(mediaDuration, video.timeScale, recipe.movieTimeScale);
    std::vector<Bytes> minf = {Atom("vmhd", Bytes{0, 0, 0, 1, 0, 0x40, 0x80, 0, 0x80, 0, 0x80, 0})};
    if (recipe.dataHandlerInMinf) {
        minf.push_back(Hdlr("dhlr", "alis", "Data Handler"));
    }
    minf.push_back(Dinf());
    minf.push_back(Container(
        "stbl", {VideoDescription(video), Stts(video.frameCount, video.frameDuration), Stsc(plan.videoChunks),
                 Stsz(plan.videoChunks, video.perSampleSizes ? 0 : plan.videoFrameSize, video.frameCount),
                 ChunkOffsets(plan.videoChunks, co64)}));
    std::vector<Bytes> trak = {Tkhd(kVideoTrackId, movieDuration, false, video.width, video.height)};
    if (video.edit) {
        trak.push_back(Edts(movieDuration, 0, true));
    }
    trak.push_back(Container("mdia", {Mdhd(video.timeScale, static_cast<uint32_t>(mediaDuration)),
                                      Hdlr("mhlr", "vide", "Video Handler"), Container("minf", minf)}));
    return Container("trak", trak);
}

Bytes SoundTrack(const MovieRecipe& recipe, const MoviePlan& plan, bool co64)
{
    const SoundRecipe& sound = recipe.sound;
    const uint32_t rate = sound.sampleRate;
    const uint32_t movieDuration = Rescale(plan.soundFrames, rate, recipe.movieTimeScale);
    std::vector<Bytes> minf = {Atom("smhd", Bytes(8, 0))};
    if (recipe.dataHandlerInMinf) {
        minf.push_back(Hdlr("dhlr", "alis", "Data Handler"));
    }
    minf.push_back(Dinf());
    minf.push_back(Container(
        "stbl", {SoundDescription(sound, plan),
                 plan.aac ? Stts(Clamp32(plan.soundSamples), kAacFramesPerPacket) : Stts(Clamp32(plan.soundSamples), 1),
                 Stsc(plan.soundChunks), Stsz(plan.soundChunks, plan.aac ? 0 : 1, plan.soundSamples),
                 ChunkOffsets(plan.soundChunks, co64)}));
    std::vector<Bytes> trak = {Tkhd(kSoundTrackId, movieDuration, true, 0, 0)};
    if (sound.edts) {
        const uint64_t played = plan.soundFrames > plan.soundMediaTime ? plan.soundFrames - plan.soundMediaTime : 0;
        trak.push_back(Edts(Rescale(played, rate, recipe.movieTimeScale), plan.soundMediaTime, sound.elst));
    }
    trak.push_back(Container("mdia", {Mdhd(rate, Clamp32(plan.soundFrames)), Hdlr("mhlr", "soun", "Sound Handler"),
                                      Container("minf", minf)}));
    return Container("trak", trak);
}


}  // namespace

Bytes UserData(const MakerRecipe& maker, const MoviePlan& plan)
{
    std::vector<Bytes> tcdb;
    if (maker.afInformation) {
        tcdb.push_back(Atom("OP01", plan.afPayload));
    }
    if (maker.audioLevel) {
        tcdb.push_back(Atom("OP02", plan.audioLevelPayload));
    }
    tcdb.insert(tcdb.end(), maker.extraTcdbChildren.begin(), maker.extraTcdbChildren.end());
    std::vector<Bytes> tcdt;
    if (!tcdb.empty()) {
        tcdt.push_back(Container("TCDB", tcdb));
    }
    if (maker.tagAtom) {
        tcdt.push_back(Atom("TCTG", plan.tagPayload));
    }
    tcdt.insert(tcdt.end(), maker.extraTcdtChildren.begin(), maker.extraTcdtChildren.end());
    std::vector<Bytes> udta;
    if (!tcdt.empty()) {
        udta.push_back(Container("TCDT", tcdt));
    }
    udta.insert(udta.end(), maker.extraUdtaChildren.begin(), maker.extraUdtaChildren.end());
    return Container("udta", udta);
}

Bytes BuildMoov(const MovieRecipe& recipe, const MoviePlan& plan, bool co64)
{
    uint32_t duration = 0;
    std::vector<Bytes> tracks;
    if (recipe.video.present) {
        tracks.push_back(VideoTrack(recipe, plan, co64));
        duration = Rescale(uint64_t{recipe.video.frameCount} * recipe.video.frameDuration, recipe.video.timeScale,
                           recipe.movieTimeScale);
    }
    if (recipe.sound.present) {
        Bytes sound = SoundTrack(recipe, plan, co64);
        tracks.insert(recipe.soundTrackFirst ? tracks.begin() : tracks.end(), std::move(sound));
        duration = std::max(duration, Rescale(plan.soundFrames, recipe.sound.sampleRate, recipe.movieTimeScale));
    }
    std::vector<Bytes> children = {Mvhd(recipe.movieTimeScale, duration)};
    children.insert(children.end(), tracks.begin(), tracks.end());
    if (recipe.maker.userData) {
        children.push_back(UserData(recipe.maker, plan));
    }
    return Container("moov", children);
}

}  // namespace moviekit

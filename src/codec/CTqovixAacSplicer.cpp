#include "codec/CTqovixAacSplicer.h"

#include <algorithm>
#include <cmath>
#include <cstring>
#include <new>

#include "codec/AACDecoder.h"
#include "codec/AACEncoder.h"

namespace {

constexpr uint64_t kFrames = 1024;
// A fresh encoder's own packets 0 to 2 hold some of its priming silence; fed from 64 frames
// into a packet's sound, its packet 3 is the first of the track's packets with nothing else
// (which is why a span's feed starts a packet before the first it may keep).
constexpr int64_t kFeedOffset = 64;
constexpr unsigned int kStreamBufferSize = 4096;
// Decoding through a joint may differ from the sound wanted by a few times the coding noise
// heard on either side of it (a second generation here, the source's own noise there), never
// by a different window: that misses by the signal's own size.
constexpr double kJointNoiseRatio = 4.0;
constexpr double kJointPeakRatio = 3.0;
// Below this the noise is rounding: two steps a sample, and a peak of 12.
constexpr double kNoiseFloorPerSample = 4.0;
constexpr double kPeakFloor = 12.0;

}  // namespace

CTqovixAacSplicer::CTqovixAacSplicer() = default;

CTqovixAacSplicer::~CTqovixAacSplicer() = default;

eTqovixErrorCode CTqovixAacSplicer::Open(const ACFormat& pcm, const ACFormat& aac, unsigned int bitRate, Sink* sink)
{
    Close();
    if (pcm.bytesPerFrame == 0 || pcm.bytesPerFrame > 16 || pcm.bitsPerChannel != 16) {
        return eTqovixErrorInternal;
    }
    m_pcmFormat = pcm;
    m_aacFormat = aac;
    m_bitRate = bitRate;
    m_pSink = sink;
    m_frameBytes = pcm.bytesPerFrame;
    m_regionBytes = static_cast<uint32_t>(kFrames * m_frameBytes);
    // From the earliest pre-roll a change can ask for to the latest joint it can hear.
    m_heldRegions = m_tuning.margin + m_tuning.startCandidates + m_tuning.preRoll + m_tuning.CloseDistance() + 8;
    try {
        m_streamBuffer = std::make_unique<unsigned char[]>(kStreamBufferSize);
        m_partial.assign(m_regionBytes, 0);
        m_compare.assign(m_regionBytes, 0);
        m_zeros.assign(m_regionBytes, 0);
        m_held.assign(m_heldRegions, std::vector<uint8_t>(m_regionBytes, 0));
        m_checker = std::make_unique<AACDecoder>();
    } catch (const std::bad_alloc&) {
        Close();
        return eTqovixErrorOutOfMemory;
    }
    m_stream.requestProc = RequestProc;
    m_stream.resultProc = EncodedProc;
    m_stream.buffer = m_streamBuffer.get();
    m_stream.bufferSize = kStreamBufferSize;
    m_stream.userData = this;
    auto result = static_cast<eTqovixErrorCode>(m_checker->Initialize(aac, pcm));
    if (!TqovixFailed(result)) {
        m_checker->SetDecoderDelay(0U);
        result = NewEncoder();
    }
    if (TqovixFailed(result)) {
        Close();
    }
    return result;
}

void CTqovixAacSplicer::Plan(uint64_t packetCount, bool whole)
{
    m_packetCount = packetCount;
    m_bWhole = whole;
}

void CTqovixAacSplicer::Close()
{
    m_encoder.reset();
    m_checker.reset();
    m_pSink = nullptr;
    m_packetCount = 0;
    m_bWhole = false;
    m_bFinished = false;
    m_served.Clear();
    m_bServedLost = false;
    std::vector<uint8_t>().swap(m_compare);
    std::vector<uint8_t>().swap(m_partial);
    std::vector<uint8_t>().swap(m_zeros);
    m_held.clear();
    m_partialBytes = 0;
    m_nextRegion = 1;
    m_lastChanged = -1;
    m_committed = 0;
    m_lastWritten.clear();
    m_bSpan = false;
    m_bEncoderFresh = false;
    m_ownPackets = 0;
    m_encoded.clear();
    m_bStartDecided = false;
    m_endCandidate = 0;
    m_streamResult = eTqovixSuccess;
    m_statistics = Statistics{};
    m_streamBuffer.reset();
    m_stream = ACEncoderStream{};
}

eTqovixErrorCode CTqovixAacSplicer::NewEncoder()
{
    try {
        m_encoder = std::make_unique<AACEncoder>();
    } catch (const std::bad_alloc&) {
        return eTqovixErrorOutOfMemory;
    }
    const auto result =
        static_cast<eTqovixErrorCode>(m_encoder->Initialize(m_pcmFormat, m_aacFormat, m_bitRate, &m_stream));
    if (TqovixFailed(result)) {
        m_encoder.reset();
        return result;
    }
    m_encoder->SetDroppedFrames(0);
    m_bEncoderFresh = true;
    return eTqovixSuccess;
}

void CTqovixAacSplicer::KeepServed(const void* data, uint64_t size)
{
    // Kept only as far as the processing library may run ahead; past that every region counts
    // as changed, which costs encoding and never a joint.
    constexpr uint64_t kMaxServedBytes = 33 << 20;
    if (m_pSink == nullptr || m_bWhole || m_bServedLost || data == nullptr || size == 0) {
        return;
    }
    if (m_served.Size() + size > kMaxServedBytes || TqovixFailed(m_served.Push(data, size))) {
        m_bServedLost = true;
        m_served.Clear();
    }
}

eTqovixErrorCode CTqovixAacSplicer::Push(const void* data, uint64_t size)
{
    if (m_pSink == nullptr || m_packetCount == 0 || (data == nullptr && size != 0)) {
        return eTqovixErrorInternal;
    }
    const auto* bytes = static_cast<const uint8_t*>(data);
    // The sound after the track's last packet has no packet to go into.
    while (size != 0 && !m_bFinished && m_nextRegion <= m_packetCount) {
        const uint64_t take = std::min<uint64_t>(size, m_regionBytes - m_partialBytes);
        std::memcpy(m_partial.data() + m_partialBytes, bytes, take);
        m_partialBytes += take;
        bytes += take;
        size -= take;
        if (m_partialBytes == m_regionBytes) {
            const eTqovixErrorCode result = CompleteRegion(false);
            if (TqovixFailed(result)) {
                return result;
            }
        }
    }
    return m_nextRegion > m_packetCount ? Finish() : eTqovixSuccess;
}

eTqovixErrorCode CTqovixAacSplicer::Finish()
{
    if (m_bFinished) {
        return eTqovixSuccess;
    }
    if (m_pSink == nullptr || m_packetCount == 0) {
        return eTqovixErrorInternal;
    }
    if (m_partialBytes != 0) {
        std::memset(m_partial.data() + m_partialBytes, 0, m_regionBytes - m_partialBytes);
        const eTqovixErrorCode result = CompleteRegion(true);
        if (TqovixFailed(result)) {
            return result;
        }
    }
    eTqovixErrorCode result = Advance(true);
    if (!TqovixFailed(result) && !m_bSpan) {
        result = CarryUpTo(m_packetCount);  // sound never pushed back goes out as it came
    }
    if (TqovixFailed(result)) {
        return result;
    }
    m_bFinished = m_committed >= m_packetCount;
    return m_bFinished ? eTqovixSuccess : eTqovixErrorInternal;
}

eTqovixErrorCode CTqovixAacSplicer::CompleteRegion(bool partial)
{
    const uint64_t region = m_nextRegion;
    const uint64_t length = partial ? m_partialBytes : m_regionBytes;
    bool changed = m_bWhole;
    if (!changed) {
        if (m_bServedLost || m_served.Size() < length) {
            m_bServedLost = true;
            m_served.Clear();
            changed = true;
        } else {
            m_served.Pop(m_compare.data(), length);
            changed = std::memcmp(m_compare.data(), m_partial.data(), length) != 0;
        }
    }
    std::swap(m_held[region % m_heldRegions], m_partial);
    m_partialBytes = 0;
    ++m_nextRegion;
    if (changed) {
        m_lastChanged = static_cast<int64_t>(region);
        if (!m_bSpan) {
            const eTqovixErrorCode result = StartSpan(region);
            if (TqovixFailed(result)) {
                return result;
            }
        }
    }
    return partial ? eTqovixSuccess : Advance(false);
}

eTqovixErrorCode CTqovixAacSplicer::StartSpan(uint64_t changedRegion)
{
    // Changed sound in region r lies under the frames of packets r - 1 and r.
    uint64_t nominal = changedRegion > 1 + m_tuning.margin ? changedRegion - 1 - m_tuning.margin : 0;
    nominal = std::max(nominal, m_committed);
    if (m_committed == 0 && nominal < m_tuning.preRoll + 1) {
        // So near the start that the whole beginning is re-encoded rather than joined.
        nominal = 0;
    }
    m_bSpan = true;
    m_bStartDecided = false;
    m_bStartRetried = false;
    m_endCandidate = 0;
    ++m_statistics.spans;
    // The place the change asks for is tried first; earlier ones only when its joint is heard.
    return BeginEncoding(nominal, nominal);
}

eTqovixErrorCode CTqovixAacSplicer::BeginEncoding(uint64_t earliest, uint64_t nominal)
{
    if (!m_bEncoderFresh) {
        const eTqovixErrorCode result = NewEncoder();
        if (TqovixFailed(result)) {
            return result;
        }
    }
    m_bEncoderFresh = false;
    const int64_t first = std::max<int64_t>(static_cast<int64_t>(earliest) - 2 - static_cast<int64_t>(m_tuning.preRoll), -1);
    m_alignment = first - 1;
    m_ownPackets = 0;
    m_fed = first * static_cast<int64_t>(kFrames) + kFeedOffset;
    m_encoded.clear();
    m_keepFrom = earliest;
    m_nominalStart = nominal;
    m_earliestStart = earliest;
    return eTqovixSuccess;
}

eTqovixErrorCode CTqovixAacSplicer::EnsureEncoded(uint64_t index)
{
    // Packet g's frame and the encoder's look-ahead reach 64 frames into served region g + 2.
    const uint64_t seen = m_nextRegion - 1;
    const int64_t wanted = static_cast<int64_t>((std::min(index, m_packetCount) + 2) * kFrames) + kFeedOffset;
    return Feed(std::min(wanted, static_cast<int64_t>(seen * kFrames)));
}

const uint8_t* CTqovixAacSplicer::HeldRegion(uint64_t region) const
{
    if (region >= m_nextRegion || region + m_heldRegions < m_nextRegion || region == 0) {
        return nullptr;
    }
    return m_held[region % m_heldRegions].data();
}

eTqovixErrorCode CTqovixAacSplicer::Feed(int64_t until)
{
    while (m_fed < until) {
        uint64_t frames = 0;
        const uint8_t* data = nullptr;
        if (m_fed < 0) {
            frames = std::min<uint64_t>(static_cast<uint64_t>(-m_fed), static_cast<uint64_t>(until - m_fed));
            frames = std::min(frames, kFrames);
            data = m_zeros.data();
        } else {
            const auto served = static_cast<uint64_t>(m_fed);
            const uint64_t offset = served % kFrames;
            frames = std::min(kFrames - offset, static_cast<uint64_t>(until) - served);
            data = HeldRegion(served / kFrames + 1);
            if (data == nullptr) {
                return eTqovixErrorInternal;
            }
            data += offset * m_frameBytes;
        }
        const auto result = static_cast<eTqovixErrorCode>(
            m_encoder->Encode(const_cast<uint8_t*>(data), static_cast<unsigned int>(frames * m_frameBytes)));
        if (TqovixFailed(m_streamResult)) {
            return m_streamResult;
        }
        if (TqovixFailed(result)) {
            return result;
        }
        m_fed += static_cast<int64_t>(frames);
    }
    return eTqovixSuccess;
}

unsigned char* CTqovixAacSplicer::RequestProc(void* stream, unsigned int size)
{
    const auto* lent = static_cast<const ACEncoderStream*>(stream);
    return lent != nullptr && lent->bufferSize > size ? lent->buffer : nullptr;
}

eTqovixErrorCode CTqovixAacSplicer::EncodedProc(void* stream, unsigned char* data, unsigned int size)
{
    auto* self = static_cast<CTqovixAacSplicer*>(static_cast<ACEncoderStream*>(stream)->userData);
    self->m_streamResult = self->TakeEncoded(data, size);
    return self->m_streamResult;
}

eTqovixErrorCode CTqovixAacSplicer::TakeEncoded(const uint8_t* data, uint32_t size)
{
    const int64_t index = static_cast<int64_t>(m_ownPackets++) + m_alignment;
    if (index < static_cast<int64_t>(m_keepFrom) || static_cast<uint64_t>(index) >= m_packetCount) {
        return eTqovixSuccess;
    }
    if (size == 0 || data == nullptr) {
        return eTqovixErrorInternal;
    }
    try {
        m_encoded.push_back(Packet{static_cast<uint64_t>(index), std::vector<uint8_t>(data, data + size)});
    } catch (const std::bad_alloc&) {
        return eTqovixErrorOutOfMemory;
    }
    return eTqovixSuccess;
}

const CTqovixAacSplicer::Packet* CTqovixAacSplicer::Encoded(uint64_t index) const
{
    if (m_encoded.empty() || index < m_encoded.front().index || index > m_encoded.back().index) {
        return nullptr;
    }
    return &m_encoded[index - m_encoded.front().index];
}

eTqovixErrorCode CTqovixAacSplicer::WrittenOrSource(uint64_t index, std::vector<uint8_t>& scratch,
                                                    const std::vector<uint8_t>*& packet)
{
    for (const Packet& written : m_lastWritten) {
        if (written.index == index) {
            packet = &written.bytes;
            return eTqovixSuccess;
        }
    }
    packet = &scratch;
    return m_pSink->ReadSourcePacket(index, scratch);
}

CTqovixAacSplicer::Heard CTqovixAacSplicer::Hear(const std::vector<uint8_t>& first,
                                                 const std::vector<uint8_t>& second, uint64_t region)
{
    Heard heard;
    const uint8_t* wanted = HeldRegion(region);
    if (wanted == nullptr || first.empty() || second.empty()) {
        return heard;
    }
    alignas(int16_t) uint8_t pcm[AACDecoder::kMaxPcmSize];
    unsigned int size = 0;
    unsigned int used = 0;
    // The first packet only leaves its frame's second half behind, for the second to complete.
    if (m_checker->Decode(pcm, &size, &used, first.data(), static_cast<unsigned int>(first.size())) !=
            eConverterSuccess ||
        m_checker->Decode(pcm, &size, &used, second.data(), static_cast<unsigned int>(second.size())) !=
            eConverterSuccess ||
        size != m_regionBytes) {
        return heard;
    }
    for (uint64_t k = 0; k < size / 2; ++k) {
        int16_t got = 0;
        int16_t want = 0;
        std::memcpy(&got, pcm + 2 * k, 2);
        std::memcpy(&want, wanted + 2 * k, 2);
        const double difference = static_cast<double>(got) - static_cast<double>(want);
        heard.error += difference * difference;
        heard.peak = std::max(heard.peak, std::fabs(difference));
    }
    heard.valid = true;
    return heard;
}

bool CTqovixAacSplicer::Accept(const Heard& joint, const Heard& before, const Heard& after, double& ratio)
{
    const double samples = static_cast<double>(m_regionBytes / 2);
    double noise = kNoiseFloorPerSample * samples;
    double peak = kPeakFloor;
    for (const Heard* side : {&before, &after}) {
        if (side->valid) {
            noise = std::max(noise, side->error);
            peak = std::max(peak, side->peak);
        }
    }
    ratio = joint.valid ? joint.error / noise : HUGE_VAL;
    return joint.valid && ratio <= kJointNoiseRatio && joint.peak <= kJointPeakRatio * peak;
}

eTqovixErrorCode CTqovixAacSplicer::Advance(bool final)
{
    const uint64_t seen = m_nextRegion - 1;
    if (!m_bSpan) {
        // A change still to come reaches back no further than its earliest start.
        const uint64_t reach = m_tuning.margin + m_tuning.startCandidates;
        return CarryUpTo(final ? m_packetCount : std::min(m_packetCount, seen > reach ? seen - reach : 0));
    }
    if (final && seen >= m_packetCount) {
        const eTqovixErrorCode result = FeedToEnd();
        if (TqovixFailed(result)) {
            return result;
        }
    }
    if (!m_bStartDecided) {
        const eTqovixErrorCode result = DecideStart(final);
        if (TqovixFailed(result) || !m_bStartDecided) {
            return result;
        }
    }
    // Whatever comes next, the span keeps the packets up to the margin past its last change.
    const uint64_t kept = static_cast<uint64_t>(m_lastChanged) + 1 + m_tuning.margin;
    eTqovixErrorCode result = EnsureEncoded(kept - 1);
    if (!TqovixFailed(result)) {
        result = WriteEncodedUpTo(kept);
    }
    return TqovixFailed(result) ? result : TryEnd(final);
}

eTqovixErrorCode CTqovixAacSplicer::FeedToEnd()
{
    // Every sound is in: the encoder takes silence after it for its look-ahead, as the source's did.
    const eTqovixErrorCode result = EnsureEncoded(m_packetCount);
    if (TqovixFailed(result)) {
        return result;
    }
    for (int k = 0; k < 4 && (m_encoded.empty() || m_encoded.back().index + 1 < m_packetCount); ++k) {
        const auto encoded =
            static_cast<eTqovixErrorCode>(m_encoder->Encode(m_zeros.data(), static_cast<unsigned int>(m_regionBytes)));
        if (TqovixFailed(m_streamResult) || TqovixFailed(encoded)) {
            return TqovixFailed(m_streamResult) ? m_streamResult : encoded;
        }
    }
    return eTqovixSuccess;
}

eTqovixErrorCode CTqovixAacSplicer::DecideStart(bool final)
{
    const uint64_t last = std::min(m_nominalStart + 1, m_packetCount - 1);
    const eTqovixErrorCode fed = final && m_nextRegion > m_packetCount ? FeedToEnd() : EnsureEncoded(last);
    if (TqovixFailed(fed)) {
        return fed;
    }
    if (Encoded(last) == nullptr) {
        if (!final) {
            return eTqovixSuccess;
        }
        return eTqovixErrorInternal;  // the sound stopped before the span could begin
    }
    uint64_t chosen = m_nominalStart;
    double best = HUGE_VAL;
    bool heard = m_nominalStart == 0;
    Heard chosenJoint;
    for (uint64_t start = m_nominalStart + 1; !heard && start-- > m_earliestStart;) {
        if (start == 0) {
            chosen = 0;
            heard = true;
            break;
        }
        const std::vector<uint8_t>* previous = nullptr;
        eTqovixErrorCode result = WrittenOrSource(start - 1, m_firstPacket, previous);
        if (TqovixFailed(result)) {
            return result;
        }
        const Packet* own = Encoded(start);
        const Packet* next = Encoded(start + 1);
        const Heard joint = Hear(*previous, own->bytes, start);
        const Heard after = next != nullptr ? Hear(own->bytes, next->bytes, start + 1) : Heard{};
        Heard before;
        if (start >= 2) {
            const std::vector<uint8_t>* earlier = nullptr;
            result = WrittenOrSource(start - 2, m_secondPacket, earlier);
            if (TqovixFailed(result)) {
                return result;
            }
            before = Hear(*earlier, *previous, start - 1);
        }
        double ratio = 0;
        heard = Accept(joint, before, after, ratio);
        if (heard || ratio < best) {
            best = ratio;
            chosen = start;
            chosenJoint = joint;
        }
    }
    if (!heard && !m_bStartRetried && m_earliestStart > m_committed) {
        // Heard to differ where the change asked: a window the source switched for a sound that
        // processing took away, most likely. A fresh encoder tries earlier places too.
        m_bStartRetried = true;
        const uint64_t nominal = m_nominalStart;
        const uint64_t earliest = std::max(nominal > m_tuning.startCandidates ? nominal - m_tuning.startCandidates : 0,
                                           m_committed);
        const eTqovixErrorCode result = BeginEncoding(earliest, nominal);
        return TqovixFailed(result) ? result : DecideStart(final);
    }
    if (chosen != 0) {
        ++m_statistics.joints;
        m_statistics.startsMoved += m_bStartRetried ? 1 : 0;
        m_statistics.unheardJoints += heard ? 0 : 1;
        m_statistics.worstJointRatio = std::max(m_statistics.worstJointRatio, best);
        m_statistics.worstJointPeak = std::max(m_statistics.worstJointPeak, chosenJoint.peak);
    }
    const eTqovixErrorCode result = CarryUpTo(chosen);
    if (TqovixFailed(result)) {
        return result;
    }
    while (!m_encoded.empty() && m_encoded.front().index < chosen) {
        m_encoded.erase(m_encoded.begin());
    }
    m_bStartDecided = true;
    return eTqovixSuccess;
}

eTqovixErrorCode CTqovixAacSplicer::TryEnd(bool final)
{
    const uint64_t seen = m_nextRegion - 1;
    m_endCandidate = std::max(m_endCandidate, static_cast<uint64_t>(m_lastChanged) + 1 + m_tuning.margin);
    for (;; ++m_endCandidate) {
        const uint64_t end = m_endCandidate;
        if (end >= m_packetCount) {
            return final ? RunSpanToEnd() : eTqovixSuccess;
        }
        if (!final && seen < end + m_tuning.CloseDistance()) {
            return eTqovixSuccess;
        }
        eTqovixErrorCode result = EnsureEncoded(end - 1);
        if (TqovixFailed(result)) {
            return result;
        }
        const Packet* last = Encoded(end - 1);
        const Packet* before = Encoded(end - 2);
        if (last == nullptr || seen < end + 1) {
            // Only a library that stopped early leaves a span without the sound to end it.
            return final ? eTqovixErrorInternal : eTqovixSuccess;
        }
        const std::vector<uint8_t>* source = nullptr;
        result = WrittenOrSource(end, m_firstPacket, source);
        if (TqovixFailed(result)) {
            return result;
        }
        const Heard joint = Hear(last->bytes, *source, end);
        const Heard inside = before != nullptr ? Hear(before->bytes, last->bytes, end - 1) : Heard{};
        Heard outside;
        if (end + 1 < m_packetCount) {
            const std::vector<uint8_t>* next = nullptr;
            result = WrittenOrSource(end + 1, m_secondPacket, next);
            if (TqovixFailed(result)) {
                return result;
            }
            outside = Hear(*source, *next, end + 1);
        }
        double ratio = 0;
        if (!Accept(joint, inside, outside, ratio)) {
            continue;
        }
        m_pendingSizes.clear();
        for (uint64_t index = m_committed; index < end; ++index) {
            const Packet* packet = Encoded(index);
            if (packet != nullptr) {
                m_pendingSizes.push_back(static_cast<uint32_t>(packet->bytes.size()));
            }
        }
        if (m_pSink->EndFits(end, m_pendingSizes)) {
            ++m_statistics.joints;
            m_statistics.endsMoved += end != static_cast<uint64_t>(m_lastChanged) + 1 + m_tuning.margin ? 1 : 0;
            m_statistics.worstJointRatio = std::max(m_statistics.worstJointRatio, ratio);
            m_statistics.worstJointPeak = std::max(m_statistics.worstJointPeak, joint.peak);
            return CloseSpan(end);
        }
    }
}

eTqovixErrorCode CTqovixAacSplicer::RunSpanToEnd()
{
    eTqovixErrorCode result = FeedToEnd();
    if (!TqovixFailed(result)) {
        result = WriteEncodedUpTo(m_packetCount);
    }
    if (TqovixFailed(result)) {
        return result;
    }
    return m_committed >= m_packetCount ? CloseSpan(m_packetCount) : eTqovixErrorInternal;
}

eTqovixErrorCode CTqovixAacSplicer::CloseSpan(uint64_t end)
{
    eTqovixErrorCode result = WriteEncodedUpTo(end);
    if (TqovixFailed(result)) {
        return result;
    }
    m_lastWritten.clear();
    for (Packet& packet : m_encoded) {
        if (packet.index + 2 >= end && packet.index < end) {
            m_lastWritten.push_back(std::move(packet));
        }
    }
    m_encoded.clear();
    m_encoder.reset();
    m_bEncoderFresh = false;
    m_bSpan = false;
    return eTqovixSuccess;
}

eTqovixErrorCode CTqovixAacSplicer::CarryUpTo(uint64_t end)
{
    if (end <= m_committed) {
        return eTqovixSuccess;
    }
    const eTqovixErrorCode result = m_pSink->CarrySourcePackets(end - m_committed);
    if (TqovixFailed(result)) {
        return result;
    }
    m_statistics.carried += end - m_committed;
    m_committed = end;
    return eTqovixSuccess;
}

eTqovixErrorCode CTqovixAacSplicer::WriteEncodedUpTo(uint64_t end)
{
    while (m_committed < end) {
        const Packet* packet = Encoded(m_committed);
        if (packet == nullptr) {
            break;
        }
        const eTqovixErrorCode result =
            m_pSink->WriteEncodedPacket(packet->bytes.data(), static_cast<uint32_t>(packet->bytes.size()));
        if (TqovixFailed(result)) {
            return result;
        }
        ++m_committed;
        ++m_statistics.encoded;
    }
    // What a joint at the span's end may still have to hear stays; the rest goes.
    while (m_encoded.size() > 2 && m_encoded.front().index + 2 < m_committed) {
        m_encoded.erase(m_encoded.begin());
    }
    return eTqovixSuccess;
}

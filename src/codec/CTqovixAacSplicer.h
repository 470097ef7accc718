// Between the processing library's sound and the writer of an AAC track: packets whose
// sound came back as it was served are carried as the source's own bytes; where the sound
// changed, a span of packets is re-encoded, from a pre-roll that settles the encoder, and
// spliced in only where decoding across the joint gives the sound within coding noise.
#pragma once

#include <cstdint>
#include <memory>
#include <vector>

#include "audio/TqovixByteQueue.h"
#include "codec/ACEncoderStream.h"
#include "codec/ACFormat.h"

class AACDecoder;
class AACEncoder;

class CTqovixAacSplicer {
public:
    // The writer's side. Packets are handed over strictly in track order.
    class Sink {
    public:
        virtual ~Sink() = default;
        virtual eTqovixErrorCode CarrySourcePackets(uint64_t count) = 0;
        virtual eTqovixErrorCode WriteEncodedPacket(const uint8_t* packet, uint32_t size) = 0;
        // Source packet `index`, for hearing a joint before it is made.
        virtual eTqovixErrorCode ReadSourcePacket(uint64_t index, std::vector<uint8_t>& packet) = 0;
        // Whether a span may end before packet `end` as far as the writer goes: one that gives
        // re-encoded packets the bytes of those they replace asks for more of them while they do
        // not fit. `pending` are the sizes of the re-encoded packets not yet handed over, up to `end`.
        virtual bool EndFits(uint64_t /*end*/, const std::vector<uint32_t>& /*pending*/) const { return true; }
    };

    struct Tuning {
        // Packets re-encoded before the first one that may be kept, so that the encoder's rate
        // control and window choice run as they would mid-stream.
        uint64_t preRoll = 8;
        // Packets re-encoded beyond the two whose frames overlap changed sound, on either side.
        uint64_t margin = 2;
        // Earlier places tried for a span's start when its first joint is heard to differ.
        uint64_t startCandidates = 6;
        // A span ends only this many unchanged packets before the next change could claim them
        // back (at least margin + startCandidates + 3).
        uint64_t CloseDistance() const { return margin + startCandidates + 3; }
    };
    // For measuring other choices: before Open.
    void SetTuning(const Tuning& tuning) { m_tuning = tuning; }

    struct Statistics {
        uint64_t carried = 0;
        uint64_t encoded = 0;
        uint64_t spans = 0;
        uint64_t joints = 0;         // splices made between carried and re-encoded packets
        uint64_t unheardJoints = 0;  // made without a candidate within coding noise
        uint64_t startsMoved = 0;    // span starts heard to differ at the first place tried
        uint64_t endsMoved = 0;      // span ends likewise
        double worstJointRatio = 0;  // a joint's error over the coding noise beside it
        double worstJointPeak = 0;   // its largest sample difference, in 16-bit steps
    };

    CTqovixAacSplicer();
    ~CTqovixAacSplicer();
    CTqovixAacSplicer(const CTqovixAacSplicer&) = delete;
    CTqovixAacSplicer& operator=(const CTqovixAacSplicer&) = delete;

    // `pcm` is the 16-bit sound served and pushed back, `aac` the track's. An encoder and a
    // decoder are opened at once, so that codecs that cannot open fail the job's start.
    // Without a sink the codecs are only opened.
    eTqovixErrorCode Open(const ACFormat& pcm, const ACFormat& aac, unsigned int bitRate, Sink* sink);
    // The track's packet count; `whole` re-encodes every packet (a stream we cannot splice into).
    void Plan(uint64_t packetCount, bool whole);
    void Close();

    // The sound as served to the processing library, in order.
    void KeepServed(const void* data, uint64_t size);
    // The processed sound, in order; the end of the track finishes by itself.
    eTqovixErrorCode Push(const void* data, uint64_t size);
    // Everything not yet handed over; sound never pushed goes out as it came.
    eTqovixErrorCode Finish();
    bool IsFinished() const { return m_bFinished; }
    const Statistics& GetStatistics() const { return m_statistics; }

private:
    struct Heard {
        double error = 0;  // sum of squared differences against the sound wanted
        double peak = 0;   // largest difference
        bool valid = false;
    };
    struct Packet {
        uint64_t index = 0;
        std::vector<uint8_t> bytes;
    };

    eTqovixErrorCode CompleteRegion(bool final);
    eTqovixErrorCode StartSpan(uint64_t changedRegion);
    // A fresh encoder whose first packet kept is `earliest`; `nominal` is the latest start tried.
    eTqovixErrorCode BeginEncoding(uint64_t earliest, uint64_t nominal);
    // Feeds the encoder as far as packet `index` needs and the sound allows.
    eTqovixErrorCode EnsureEncoded(uint64_t index);
    // At the end of the track: every packet the span can still need.
    eTqovixErrorCode FeedToEnd();
    eTqovixErrorCode Feed(int64_t until);
    eTqovixErrorCode Advance(bool final);
    eTqovixErrorCode DecideStart(bool final);
    eTqovixErrorCode TryEnd(bool final);
    eTqovixErrorCode RunSpanToEnd();
    eTqovixErrorCode CloseSpan(uint64_t end);
    eTqovixErrorCode CarryUpTo(uint64_t end);
    eTqovixErrorCode WriteEncodedUpTo(uint64_t end);
    eTqovixErrorCode TakeEncoded(const uint8_t* data, uint32_t size);
    static eTqovixErrorCode EncodedProc(void* stream, unsigned char* data, unsigned int size);
    static unsigned char* RequestProc(void* stream, unsigned int size);

    const Packet* Encoded(uint64_t index) const;
    // The packet the destination holds, or will hold, at `index` outside the open span.
    eTqovixErrorCode WrittenOrSource(uint64_t index, std::vector<uint8_t>& scratch, const std::vector<uint8_t>*& packet);
    const uint8_t* HeldRegion(uint64_t region) const;
    // Decodes `first` then `second` and compares the second's sound with stream region `region`.
    Heard Hear(const std::vector<uint8_t>& first, const std::vector<uint8_t>& second, uint64_t region);
    // Whether a joint's sound lies within the coding noise heard beside it; keeps the figures.
    bool Accept(const Heard& joint, const Heard& before, const Heard& after, double& ratio);
    eTqovixErrorCode NewEncoder();

    Tuning m_tuning;
    uint64_t m_heldRegions = 0;
    ACFormat m_pcmFormat{};
    ACFormat m_aacFormat{};
    unsigned int m_bitRate = 0;
    Sink* m_pSink = nullptr;
    uint32_t m_frameBytes = 0;
    uint32_t m_regionBytes = 0;
    uint64_t m_packetCount = 0;
    bool m_bWhole = false;
    bool m_bFinished = false;

    TqovixByteQueue m_served;
    bool m_bServedLost = false;
    std::vector<uint8_t> m_compare;
    // Stream region k holds the frames [1024 k, 1024 (k + 1)) of the decoded stream; served
    // sound begins with region 1, behind the packet the decoder keeps to itself.
    std::vector<uint8_t> m_partial;
    uint64_t m_partialBytes = 0;
    uint64_t m_nextRegion = 1;
    std::vector<std::vector<uint8_t>> m_held;  // the last regions, by region modulo its size
    int64_t m_lastChanged = -1;

    uint64_t m_committed = 0;
    // The last packets of the previous span, which a following joint may have to hear.
    std::vector<Packet> m_lastWritten;

    // The open span.
    bool m_bSpan = false;
    std::unique_ptr<AACEncoder> m_encoder;
    bool m_bEncoderFresh = false;
    ACEncoderStream m_stream{};
    std::unique_ptr<unsigned char[]> m_streamBuffer;
    int64_t m_alignment = 0;       // own packet n is packet n + m_alignment of the track
    uint64_t m_ownPackets = 0;
    int64_t m_fed = 0;             // next served frame to encode (negative: silence before the track)
    std::vector<Packet> m_encoded;  // re-encoded packets still needed, in order
    uint64_t m_keepFrom = 0;
    bool m_bStartDecided = false;
    bool m_bStartRetried = false;
    uint64_t m_nominalStart = 0;
    uint64_t m_earliestStart = 0;
    uint64_t m_endCandidate = 0;
    eTqovixErrorCode m_streamResult = eTqovixSuccess;

    std::unique_ptr<AACDecoder> m_checker;
    std::vector<uint8_t> m_firstPacket;
    std::vector<uint8_t> m_secondPacket;
    std::vector<uint8_t> m_zeros;
    std::vector<uint32_t> m_pendingSizes;
    Statistics m_statistics;
};

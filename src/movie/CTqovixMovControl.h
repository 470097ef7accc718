// One job's movie files: opens and analyses the source, serves the processing
// library's input callbacks from it, and writes the destination movie.
#pragma once

#include <cstdint>
#include <string>
#include <utility>
#include <vector>

#include "atom/CTqovixAtomControl.h"
#include "audio/TqovixByteQueue.h"
#include "movie/CTqovixBackgroundCopy.h"
#include "bridge/TqovixInterfaceConvert.h"
#include "codec/CTqovixAudioDataControlMac.h"
#include "file/CTqovixFile.h"
#include "visitor/TqovixChunkInformation.h"

class CTqovixMainFrame;
class CTqovixAudioInformationVisitor;

// What kind of refusal the words of GetRefusal describe, for hosts that sort them.
enum class eTqovixRefusal {
    None,
    NotAMovie,          // not a QuickTime/ISO movie of an accepted brand, or atoms that do not add up
    Fragmented,
    NoSoundTrack,
    UnsupportedSound,   // a sound format, depth or channel count not processed
    UnsupportedLayout,  // media elsewhere, or chunk sizes that cannot be known
    NoAFInformation,
    Malformed,          // tables that contradict each other or point past the end
};

class CTqovixMovControl : public CTqovixAacSplicer::Sink {
public:
    CTqovixMovControl() = default;
    CTqovixMovControl(const CTqovixMovControl&) = delete;
    CTqovixMovControl& operator=(const CTqovixMovControl&) = delete;

    // Without a destination the source is opened and analysed as for a job (what the
    // property query asks), but nothing is prepared for writing.
    eTqovixErrorCode Initialize(const char* sourcePath, const char* destinationPath);
    // Why the last Initialize refused the movie, in words for people; empty when it did not.
    const std::string& GetRefusal() const { return m_refusal; }
    eTqovixRefusal GetRefusalKind() const { return m_refusalKind; }
    // AAC: why the whole track is re-encoded rather than only the spans around the changes, in
    // words; empty when the source's packets are kept wherever the sound comes back unchanged
    // (and for PCM). Known after Initialize.
    const std::string& GetAacWholeReason() const { return m_aacWholeReason; }
    void Close();

    eTqovixErrorCode GetAFInformation(void* buffer, unsigned long* delivered, unsigned long size,
                                      unsigned long skip) const;
    // 154 instead of 0 when the movie has no audio level information.
    eTqovixErrorCode GetAudioLevelInformation(void* buffer, unsigned long* delivered, unsigned long size,
                                              unsigned long skip) const;
    eTqovixErrorCode GetAudioData(void* buffer, unsigned long* delivered, unsigned long size, unsigned long skip) const;
    // Opens the AAC codecs when the track needs them.
    eTqovixErrorCode GetAudioInformation(TqovixInterfaceConvert::TqovixAudioInformation& information);
    eTqovixErrorCode GetTrimInformation(TqovixInterfaceConvert::TqovixTrimInformation& information) const;
    bool IsPCMCodec() const { return m_bPCM; }
    bool IsAACCodec() const { return !m_bPCM; }
    void GetMainFrame(CTqovixMainFrame* mainFrame) { m_pMainFrame = mainFrame; }

    // Writing the destination.
    eTqovixErrorCode SetMovieMetaData(const void* data, unsigned long size);
    eTqovixErrorCode WriteMetaData(const void* data, unsigned long size);
    eTqovixErrorCode WriteMovieMetaData();
    // Source position to destination position through m_copyBuffer, for files the kernel cannot copy between.
    eTqovixErrorCode CopyThroughBuffer(uint32_t size);
    // The AAC splicer's writer: packets in track order, the source's own or re-encoded.
    eTqovixErrorCode CarrySourcePackets(uint64_t count) override;
    eTqovixErrorCode WriteEncodedPacket(const uint8_t* packet, uint32_t size) override;
    eTqovixErrorCode ReadSourcePacket(uint64_t index, std::vector<uint8_t>& packet) override;
    bool EndFits(uint64_t end, const std::vector<uint32_t>& pending) const override;
    eTqovixErrorCode SetMovieDataInformation(const void* afInformation, unsigned long size);
    // Every sound and video chunk is in the destination (the moov may still be missing).
    bool IsMediaDataComplete() const;
    // The finishing step has written the moov and the media data size.
    bool IsDestinationComplete() const { return m_bDestinationComplete; }
    // Gives the complete destination its name, replacing what stood there in one step.
    eTqovixErrorCode PublishDestination() { return m_destinationFile.Publish(false, &m_sourceFile); }
    // True once after the splicer has handed over the last packet. The job is finished when the
    // library reports its end, never inside a push, so that no codec is closed under its own feet.
    bool TakeFinishPending();
    // AAC: hands over what the splicer holds when the library has ended (the rest of a track it
    // stopped short of goes out as it came).
    eTqovixErrorCode FlushEncoder();
    // Copy, then patch: a source laid out as leading atoms, one mdat that its chunks fill
    // exactly, then the moov, becomes a kernel copy of itself (sharing extents where the file
    // system can) with only changed sound and the new moov written over it: PCM samples that
    // changed, AAC packets re-encoded (filled out to the bytes of the packets they replace; a
    // chunk they outgrow is laid out from there on as the general writer lays it out). The
    // result is byte for byte what the general writer gives. Tests turn it off to compare the two.
    static void SetPatchWriting(bool enabled);
    // How much served sound is kept to compare with what comes back before the file is read
    // instead; 0 restores the default. Tests make it small to compare with the file.
    static void SetServedSoundLimit(uint64_t bytes);
    // The destination began as a copy (patched still, or laid out in order after a chunk).
    bool IsPatching() const { return m_bPatching || m_bPatchStopped; }
    // Asked between the pieces of long copies (the patching copy, large carried chunks) with
    // the bytes copied and in all: a failure code stops the job with it. The engine answers
    // with aborts and the host's progress callback, which the library cannot ask meanwhile.
    void SetKeepGoing(CTqovixBackgroundCopy::KeepGoing keepGoing) { m_keepGoing = std::move(keepGoing); }
    // How much of the patching copy is done, 0 to 1; 1 when there is none.
    double GetCopyFraction();

private:
    eTqovixErrorCode InitializeDestination(const char* sourcePath, const char* destinationPath);
    eTqovixErrorCode AnalyzeTracks(bool forJob);
    // Fragments keep their samples outside the tables: such a movie is refused before anything else.
    eTqovixErrorCode RefuseFragmented();
    eTqovixErrorCode AnalyzeSoundFormat(const CTqovixAudioInformationVisitor& information);
    // Whether our encoder's packets can stand between the source's: the same profile, rate and
    // channel elements, and the windows' shape a decoder carries across a joint.
    eTqovixErrorCode ExamineAacSplicing(const CTqovixAudioInformationVisitor& information);
    eTqovixErrorCode GatherCarriedTracks(uint32_t soundTrack, uint32_t soundFrameBytes, uint64_t fileSize);
    eTqovixErrorCode Refuse(eTqovixErrorCode code, eTqovixRefusal kind, std::string reason);
    // Planning the destination: the mdat header's form from what will go in.
    bool NeedsLargeMediaDataHeader(bool largeSource) const;
    // Whether the destination the general writer would give is the source with new sound
    // bytes and a new moov at `moovOffset`.
    bool CanPatch(const TqovixAtomList& atoms, uint64_t& moovOffset) const;
    eTqovixErrorCode BeginPatching(bool& started);
    // Writes processed PCM over the copy at `offset`, and only the samples that differ from the source.
    eTqovixErrorCode PatchSound(uint64_t offset, const uint8_t* data, uint32_t size, bool swap);
    eTqovixErrorCode WriteMovieAtom();
    void KeepServedSound(eTqovixErrorCode served, const void* buffer, const unsigned long* delivered) const;
    // The next `size` bytes of the source's sound as served, into m_compareBuffer.
    eTqovixErrorCode TakeServedSound(uint64_t offset, uint32_t size, bool swapped);
    // Rewriting the tables of every track whose chunks moved.
    eTqovixErrorCode RewriteTables(const void* afInformation, unsigned long size);
    eTqovixErrorCode WriteLeadingAtoms();
    eTqovixErrorCode WriteMediaDataHeader(const TqovixAtomList& atoms);
    eTqovixErrorCode WritePcm(const uint8_t* data, unsigned long size, bool swap);
    eTqovixErrorCode WriteAacPacket(const uint8_t* packet, unsigned long size);
    // The next `count` source packets written at the destination's position (the general writer).
    eTqovixErrorCode CarryAacPackets(uint64_t count);
    // A gathered AAC chunk: its re-encoded packets filled out where they fit the source's bytes,
    // then written in place (patching) or in order (the general writer).
    eTqovixErrorCode LayOutAacChunk();
    eTqovixErrorCode WriteAacChunkInOrder();
    // Patching: from sound chunk `chunk` on, the general writer's way, over the copy.
    eTqovixErrorCode StopPatchingAt(const TqovixChunkInformation& chunk);
    // Patching: bytes written over the copy, which is kept off them.
    eTqovixErrorCode PatchBytes(uint64_t at, const uint8_t* data, uint32_t size);
    // Where the next packet of the current sound chunk starts, opening the chunk when it is new.
    eTqovixErrorCode BeginAacPacket(TqovixChunkInformation*& output);
    void EndAacPackets(uint64_t count);
    // Counts a packet write's answer: 0 once the last sound chunk is complete.
    eTqovixErrorCode NotePacketResult(eTqovixErrorCode result);
    eTqovixErrorCode CopyPrecedingVideo();
    eTqovixErrorCode CopyRemainingVideo();
    eTqovixErrorCode CopySourceSoundTail();
    eTqovixErrorCode WriteMediaDataSize();
    eTqovixErrorCode WriteSwapped(const uint8_t* data, unsigned long size);

    CTqovixFile m_sourceFile;
    CTqovixFile m_destinationFile;
    CTqovixAtomControl m_atomControl;
    mutable CTqovixAudioDataControlMac m_audioDataControl;  // served from the const audio reader
    CTqovixMainFrame* m_pMainFrame = nullptr;
    bool m_bHeaderPending = true;
    bool m_bPCM = true;
    std::vector<uint8_t> m_afInformation;
    mutable uint64_t m_afInformationPosition = 0;
    std::vector<uint8_t> m_audioLevelInformation;
    mutable uint64_t m_audioLevelInformationPosition = 0;
    std::vector<TqovixChunkInformation> m_audioChunks;
    // Every chunk carried unchanged, of every track but the processed sound track, in
    // source order; m_movieDataChunkTracks names the track ("trak" index) of each.
    std::vector<TqovixChunkInformation> m_movieDataChunks;
    std::vector<uint32_t> m_movieDataChunkTracks;
    // Carried tracks ("trak" index) with their chunk count, to rewrite their offsets.
    std::vector<std::pair<uint32_t, size_t>> m_carriedTracks;
    uint32_t m_soundTrackIndex = 0;
    uint32_t m_frameBytes = 0;  // PCM: bytes per frame of the sound track
    uint32_t m_sampleBits = 16;  // what the processing library is served
    uint32_t m_sampleBytes = 2;
    bool m_bFloatingPoint = false;
    std::string m_refusal;
    std::string m_aacWholeReason;
    eTqovixRefusal m_refusalKind = eTqovixRefusal::None;
    std::vector<TqovixChunkInformation> m_outputAudioChunks;
    std::vector<TqovixChunkInformation> m_outputMovieDataChunks;
    bool m_bBigEndian = true;
    uint64_t m_outputAudioChunkIndex = 0;
    uint64_t m_outputMovieDataChunkIndex = 0;
    uint32_t m_samplesInOutputChunk = 0;
    uint64_t m_sourceBytesInChunk = 0;  // AAC: bytes of the source chunk's packets written so far
    std::vector<uint64_t> m_chunkFirstPacket;  // AAC: each sound chunk's first packet, then the count
    // AAC: the sound chunk being gathered before it is laid out, as runs of the source's own
    // packets and of re-encoded ones; only when every chunk is small enough to be held.
    struct AacRun {
        bool encoded = false;
        uint32_t count = 0;
        uint64_t sourceBytes = 0;      // what the run's packets take in the source
        std::vector<uint8_t> bytes;    // re-encoded: the packets back to back
        std::vector<uint32_t> sizes;   // re-encoded: each packet's size
    };
    std::vector<AacRun> m_aacRuns;
    uint32_t m_aacGathered = 0;
    bool m_bGatherAacChunks = false;
    uint32_t m_bytesInOutputChunk = 0;
    uint64_t m_mediaDataSize = 0;
    int64_t m_mediaDataSizePosition = 0;
    eTqovixErrorCode m_encodeResult = eTqovixSuccess;

    // Our additions to the writer's state.
    bool m_bLargeMediaDataHeader = false;  // the mdat header written has a 64-bit size field
    bool m_bFinishPending = false;
    bool m_bDestinationComplete = false;
    // Big-endian PCM: the start of a sample that a piece ends in waits for the rest.
    uint8_t m_carried[8] = {};
    uint32_t m_carriedBytes = 0;
    std::vector<uint8_t> m_copyBuffer;  // reused for swapped PCM and video chunks the kernel cannot copy
    bool m_bPatching = false;
    bool m_bPatchCandidate = false;        // the layout allows it: the served sound is kept
    uint64_t m_moovOffset = 0;            // patching: where the source's moov starts
    uint64_t m_mediaDataStart = 0;        // patching: where the source's media data begins
    int64_t m_sourceSizePosition = 0;     // patching: where the source's mdat size field lies
    bool m_bPatchStopped = false;         // patched up to a chunk, laid out in order after it
    uint64_t m_patchEnd = UINT64_MAX;     // patching: where the last patch ended (no seek needed there)
    std::vector<uint8_t> m_compareBuffer;  // patching: the source's sound, to find what changed
    // Patching: the PCM served to the processing library and not yet handed back, so that
    // what comes back is compared with what went out without reading the file again.
    mutable TqovixByteQueue m_servedSound;
    mutable bool m_bServedOverflow = false;
    // Patching: the kernel copy of the source runs beside the sound processing. Declared
    // after the files it copies between, so that it stops before they close.
    CTqovixBackgroundCopy m_copy;
    CTqovixBackgroundCopy::KeepGoing m_keepGoing;
};

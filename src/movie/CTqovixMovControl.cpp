#include "movie/CTqovixMovControl.h"

#include <algorithm>
#include <cstring>
#include <new>

#include "bridge/TqovixCodeTable.h"
#include "file/CTqovixUtil.h"
#include "visitor/CTqovixAudioDataVisitor.h"
#include "visitor/CTqovixAudioInformationVisitor.h"
#include "visitor/CTqovixMakerBlockVisitor.h"
#include "visitor/CTqovixMovieDataVisitor.h"
#include "visitor/CTqovixTrimInformationVisitor.h"

namespace {

constexpr int kOpenRead = 1;

// The sequential reader the processing library pulls the maker blocks through: a null
// buffer asks for the size, a position past the end rewinds.
eTqovixErrorCode ReadSequentially(const std::vector<uint8_t>& block, uint64_t& position, void* buffer,
                                  unsigned long* delivered, unsigned long size, unsigned long skip)
{
    if (buffer == nullptr) {
        if (delivered != nullptr) {
            *delivered = block.size();
        }
        return eTqovixSuccess;
    }
    if (size == 0) {
        return eTqovixErrorInternal;
    }
    position = skip > block.size() - position ? block.size() : position + skip;
    if (position == block.size()) {
        if (delivered != nullptr) {
            *delivered = 0;
        }
        position = 0;
        return eTqovixSuccess;
    }
    const uint64_t count = std::min<uint64_t>(block.size() - position, size);
    CTqovixUtil::_memcpy(buffer, size, block.data() + position, count);
    position += count;
    if (delivered != nullptr) {
        *delivered = count;
    }
    return eTqovixSuccess;
}

}  // namespace

eTqovixErrorCode CTqovixMovControl::Initialize(const char* sourcePath, const char* destinationPath)
{
    m_refusal.clear();
    m_refusalKind = eTqovixRefusal::None;
    m_aacWholeReason.clear();
    if (sourcePath == nullptr || sourcePath[0] == '\0') {
        return eTqovixErrorSourceNotFound;
    }
    eTqovixErrorCode result = m_sourceFile.Open(sourcePath, kOpenRead);
    if (TqovixFailed(result)) {
        return result;
    }
    if (destinationPath != nullptr) {
        result = InitializeDestination(sourcePath, destinationPath);
        if (TqovixFailed(result)) {
            m_sourceFile.Close();
            return result;
        }
    }
    if (TqovixFailed(m_atomControl.Initialize(m_sourceFile))) {
        Close();
        return Refuse(eTqovixErrorInvalidMovie, eTqovixRefusal::NotAMovie, "not a QuickTime movie with brand 'qt  ' or 'mp42', or its atoms "
                                                "do not account for every byte of the file");
    }

    result = RefuseFragmented();
    if (TqovixFailed(result)) {
        Close();  // the refusal's words stay for GetRefusal
        return result;
    }
    CTqovixAFInformationVisitor af;
    result = m_atomControl.Analyze(af);
    if (TqovixFailed(result) || TqovixCodes::IsVerdict(result)) {
        Close();
        return result == eTqovixErrorInvalidMovie ? Refuse(result, eTqovixRefusal::NoAFInformation, "no AF information") : result;
    }
    if (af.GetAFInformationSize() == 0) {
        Close();
        return Refuse(eTqovixErrorInvalidMovie, eTqovixRefusal::NoAFInformation, "no AF information");
    }
    m_afInformation = af.TakeAFInformation();

    CTqovixAudioLevelInformationVisitor level;
    result = m_atomControl.Analyze(level);
    if (TqovixFailed(result) && result != eTqovixErrorInvalidMovie) {
        Close();
        return result;
    }
    if (!TqovixFailed(result)) {
        m_audioLevelInformation = level.TakeAudioLevelInformation();
    }
    result = AnalyzeTracks(destinationPath != nullptr);
    if (!TqovixFailed(result)) {
        // The job's start needs the trim tags too: the property query must not promise a job
        // that its start refuses.
        CTqovixTrimInformationVisitor trim;
        const eTqovixErrorCode found = m_atomControl.Analyze(trim);
        if (TqovixFailed(found)) {
            result = found == eTqovixErrorInvalidMovie
                         ? Refuse(found, eTqovixRefusal::Malformed,
                                  "the maker's tag atom lacks the trim information (removed frames and frame rate)")
                         : found;
        }
    }
    if (TqovixFailed(result)) {
        Close();
    }
    return result;
}

eTqovixErrorCode CTqovixMovControl::InitializeDestination(const char* sourcePath, const char* destinationPath)
{
    long long sourceSize = 0;
    eTqovixErrorCode result = m_sourceFile.GetFileSize(&sourceSize);
    if (TqovixFailed(result)) {
        return result;
    }
    // Two spellings of the source: opening the destination would truncate it.
    if (CTqovixUtil::IsSameFile(sourcePath, destinationPath)) {
        return eTqovixErrorGeneral;
    }
    result = m_destinationFile.ComfirmWritable(sourceSize, destinationPath);
    if (TqovixFailed(result)) {
        return result;
    }
    // Written under no name; the name is given only to a complete movie (PublishDestination).
    return m_destinationFile.OpenDestination(destinationPath);
}

void CTqovixMovControl::Close()
{
    m_copy.Stop();
    m_outputAudioChunkIndex = 0;
    m_outputMovieDataChunkIndex = 0;
    m_samplesInOutputChunk = 0;
    m_sourceBytesInChunk = 0;
    m_chunkFirstPacket.clear();
    m_bytesInOutputChunk = 0;
    m_mediaDataSize = 0;
    m_mediaDataSizePosition = 0;
    m_encodeResult = eTqovixSuccess;
    m_bBigEndian = true;
    m_outputMovieDataChunks.clear();
    m_outputAudioChunks.clear();
    m_movieDataChunks.clear();
    m_movieDataChunkTracks.clear();
    m_carriedTracks.clear();
    m_soundTrackIndex = 0;
    m_frameBytes = 0;
    m_sampleBits = 16;
    m_sampleBytes = 2;
    m_bFloatingPoint = false;
    m_audioChunks.clear();
    m_afInformationPosition = 0;
    m_audioLevelInformationPosition = 0;
    m_afInformation.clear();
    m_audioLevelInformation.clear();
    m_bHeaderPending = true;
    m_bPCM = true;
    m_pMainFrame = nullptr;
    m_bLargeMediaDataHeader = false;
    m_bFinishPending = false;
    m_bDestinationComplete = false;
    m_carriedBytes = 0;
    std::vector<uint8_t>().swap(m_copyBuffer);
    m_bPatching = false;
    m_bPatchStopped = false;
    m_mediaDataStart = 0;
    m_sourceSizePosition = 0;
    m_aacRuns.clear();
    m_aacGathered = 0;
    m_bGatherAacChunks = false;
    m_bPatchCandidate = false;
    m_servedSound.Clear();
    m_bServedOverflow = false;
    m_moovOffset = 0;
    m_patchEnd = UINT64_MAX;
    std::vector<uint8_t>().swap(m_compareBuffer);
    if (m_audioDataControl.IsInitialized() || m_audioDataControl.IsAACCodec()) {
        m_audioDataControl.Close();
    }
    if (m_atomControl.IsInitialized()) {
        m_atomControl.Close();
    }
    if (m_destinationFile.IsOpened()) {
        m_destinationFile.Close();
    }
    if (m_sourceFile.IsOpened()) {
        m_sourceFile.Close();
    }
}

eTqovixErrorCode CTqovixMovControl::GetAFInformation(void* buffer, unsigned long* delivered, unsigned long size,
                                                     unsigned long skip) const
{
    return ReadSequentially(m_afInformation, m_afInformationPosition, buffer, delivered, size, skip);
}

eTqovixErrorCode CTqovixMovControl::GetAudioLevelInformation(void* buffer, unsigned long* delivered,
                                                             unsigned long size, unsigned long skip) const
{
    const eTqovixErrorCode result =
        ReadSequentially(m_audioLevelInformation, m_audioLevelInformationPosition, buffer, delivered, size, skip);
    if (m_audioLevelInformation.empty() && !TqovixFailed(result)) {
        return eTqovixNoAudioLevel;
    }
    return result;
}

eTqovixErrorCode CTqovixMovControl::GetAudioData(void* buffer, unsigned long* delivered, unsigned long size,
                                                 unsigned long) const
{
    const eTqovixErrorCode result = m_audioDataControl.PopAudioData(buffer, delivered, size);
    KeepServedSound(result, buffer, delivered);
    return result;
}

eTqovixErrorCode CTqovixMovControl::GetAudioInformation(TqovixInterfaceConvert::TqovixAudioInformation& record)
{
    CTqovixAudioInformationVisitor information;
    const eTqovixErrorCode result = m_atomControl.Analyze(information);
    if (TqovixFailed(result)) {
        return result;
    }
    record.sampleRate = information.GetRate();
    record.sampleRateHz = information.GetSampleRateHz();
    record.channels = information.GetChannel();
    // What the library is served: the track's own samples, or the decoder's 16-bit integers.
    record.bitsPerSample = m_sampleBits;
    record.floatingPoint = m_bFloatingPoint;
    record.sampleCount = information.GetCount();
    record.startOffset = information.GetMediaTime() - information.GetPriming();
    if (information.GetAudioSpecificConfigSize() == 0) {
        return eTqovixSuccess;
    }
    m_bPCM = false;
    record.sampleRate *= 1000;
    // Spans are re-encoded a little below what the source spends on average, so that they mostly
    // fit in the bytes of the packets they replace; a whole re-encode takes the rate the
    // description claims, as it always did.
    uint64_t bitRate = information.GetAverageBitRate();
    if (m_aacWholeReason.empty() && !m_chunkFirstPacket.empty() && m_chunkFirstPacket.back() != 0) {
        constexpr double kSpanShare = 0.9;
        uint64_t bytes = 0;
        for (const TqovixChunkInformation& chunk : m_audioChunks) {
            bytes += chunk.size;
        }
        const double spent = 8.0 * static_cast<double>(bytes) * information.GetSampleRateHz() /
                             (1024.0 * static_cast<double>(m_chunkFirstPacket.back()));
        bitRate = static_cast<uint64_t>(std::min(kSpanShare * spent, 4e9));
    }
    const eTqovixErrorCode opened = m_audioDataControl.SetAACInformation(
        this, information.GetAudioSpecificConfigData(), information.GetAudioSpecificConfigSize(), record,
        static_cast<unsigned int>(bitRate));
    if (TqovixFailed(opened)) {
        return opened;
    }
    if (m_chunkFirstPacket.empty()) {
        return eTqovixErrorInternal;
    }
    m_audioDataControl.PlanSplicing(m_chunkFirstPacket.back(), !m_aacWholeReason.empty());
    record.sampleRate /= 1000;
    record.sampleCount *= 1024;
    return eTqovixSuccess;
}

eTqovixErrorCode CTqovixMovControl::GetTrimInformation(TqovixInterfaceConvert::TqovixTrimInformation& record) const
{
    CTqovixTrimInformationVisitor trim;
    const eTqovixErrorCode result = m_atomControl.Analyze(trim);
    if (TqovixFailed(result)) {
        return result;
    }
    record.frameRateNumerator = trim.GetFrameRateNumerator();
    record.frameRateDenominator = trim.GetFrameRateDenominator();
    record.removedFrameForward = trim.GetRemovedFrameForward();
    record.removedFrameBackward = trim.GetRemovedFrameBackward();
    return eTqovixSuccess;
}

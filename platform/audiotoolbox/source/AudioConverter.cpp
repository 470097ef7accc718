// The converter's C entry points: argument checks, the choice of direction, and the
// boundary that no C++ exception crosses.
#include <AudioToolbox/AudioConverter.h>

#include "AacDecoderConverter.h"
#include "AacEncoderConverter.h"
#include "AacStreamFormat.h"

#include "LibavHandles.h"

#include <cstring>
#include <memory>
#include <new>

namespace atcompat {

OSStatus CopyPropertyOut(const void* value, UInt32 valueSize, UInt32* size, void* data)
{
    if (*size < valueSize) {
        return kAudioConverterErr_BadPropertySizeError;
    }
    if (valueSize > 0) {
        std::memcpy(data, value, valueSize);
    }
    *size = valueSize;
    return noErr;
}

namespace {

template <typename Call>
OSStatus Guarded(Call call)
{
    try {
        return call();
    } catch (const std::bad_alloc&) {
        return kAudio_MemFullError;
    }
}

}  // namespace

}  // namespace atcompat

using namespace atcompat;

OSStatus AudioConverterNew(const AudioStreamBasicDescription* inSourceFormat,
                           const AudioStreamBasicDescription* inDestinationFormat,
                           AudioConverterRef* outAudioConverter)
{
    if (inSourceFormat == nullptr || inDestinationFormat == nullptr || outAudioConverter == nullptr) {
        return kAudio_ParamError;
    }
    *outAudioConverter = nullptr;
    if (LoadLibav() == nullptr) {
        // The platform's answer when a codec component is not installed.
        return kAudioConverterErr_FormatNotSupported;
    }
    return Guarded([&]() -> OSStatus {
        const bool decoding = inSourceFormat->mFormatID == kAudioFormatMPEG4AAC &&
                              inDestinationFormat->mFormatID == kAudioFormatLinearPCM;
        const bool encoding = inSourceFormat->mFormatID == kAudioFormatLinearPCM &&
                              inDestinationFormat->mFormatID == kAudioFormatMPEG4AAC;
        if (!decoding && !encoding) {
            return kAudioConverterErr_FormatNotSupported;
        }
        const AudioStreamBasicDescription& aac = decoding ? *inSourceFormat : *inDestinationFormat;
        const AudioStreamBasicDescription& pcm = decoding ? *inDestinationFormat : *inSourceFormat;
        int aacRate = 0;
        OSStatus status = CheckAacPcmPair(aac, pcm, encoding, &aacRate);
        if (status != noErr) {
            return status;
        }
        std::unique_ptr<OpaqueAudioConverter> converter;
        if (decoding) {
            std::unique_ptr<AacDecoderConverter> decoder;
            status = AacDecoderConverter::Create(aac, pcm, aacRate, &decoder);
            converter = std::move(decoder);
        } else {
            std::unique_ptr<AacEncoderConverter> encoder;
            status = AacEncoderConverter::Create(pcm, aac, aacRate, &encoder);
            converter = std::move(encoder);
        }
        if (status == noErr) {
            // The caller owns the converter until AudioConverterDispose.
            *outAudioConverter = converter.release();
        }
        return status;
    });
}

OSStatus AudioConverterDispose(AudioConverterRef inAudioConverter)
{
    if (inAudioConverter == nullptr) {
        return kAudio_ParamError;
    }
    delete inAudioConverter;
    return noErr;
}

OSStatus AudioConverterGetProperty(AudioConverterRef inAudioConverter, AudioConverterPropertyID inPropertyID,
                                   UInt32* ioPropertyDataSize, void* outPropertyData)
{
    if (inAudioConverter == nullptr || ioPropertyDataSize == nullptr || outPropertyData == nullptr) {
        return kAudio_ParamError;
    }
    return Guarded([&] { return inAudioConverter->GetProperty(inPropertyID, ioPropertyDataSize, outPropertyData); });
}

OSStatus AudioConverterSetProperty(AudioConverterRef inAudioConverter, AudioConverterPropertyID inPropertyID,
                                   UInt32 inPropertyDataSize, const void* inPropertyData)
{
    if (inAudioConverter == nullptr || (inPropertyData == nullptr && inPropertyDataSize > 0)) {
        return kAudio_ParamError;
    }
    return Guarded([&] { return inAudioConverter->SetProperty(inPropertyID, inPropertyDataSize, inPropertyData); });
}

OSStatus AudioConverterFillComplexBuffer(AudioConverterRef inAudioConverter,
                                         AudioConverterComplexInputDataProc inInputDataProc,
                                         void* inInputDataProcUserData, UInt32* ioOutputDataPacketSize,
                                         AudioBufferList* outOutputData,
                                         AudioStreamPacketDescription* outPacketDescription)
{
    if (inAudioConverter == nullptr || inInputDataProc == nullptr || ioOutputDataPacketSize == nullptr ||
        outOutputData == nullptr || outOutputData->mNumberBuffers != 1 ||
        outOutputData->mBuffers[0].mData == nullptr) {
        return kAudio_ParamError;
    }
    return Guarded([&] {
        return inAudioConverter->Fill(inInputDataProc, inInputDataProcUserData, ioOutputDataPacketSize,
                                      outOutputData, outPacketDescription);
    });
}

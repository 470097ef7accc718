// The audio converter: AAC packets to interleaved 16-bit PCM and back, pulling its
// input through a procedure the caller supplies.
#pragma once

#include <CoreAudioTypes/CoreAudioTypes.h>

#ifdef __cplusplus
extern "C" {
#endif

typedef struct OpaqueAudioConverter* AudioConverterRef;
typedef UInt32 AudioConverterPropertyID;

enum {
    kAudioConverterPropertyMaximumOutputPacketSize = 0x786F7073,  // 'xops'
    kAudioConverterCurrentOutputStreamDescription = 0x61636F64,   // 'acod'
    kAudioConverterCurrentInputStreamDescription = 0x61636964,    // 'acid'
    kAudioConverterEncodeBitRate = 0x62726174,                    // 'brat'
    kAudioConverterDecompressionMagicCookie = 0x646D6763,         // 'dmgc'
};

enum {
    kAudioConverterErr_FormatNotSupported = 0x666D743F,                // 'fmt?'
    kAudioConverterErr_OperationNotSupported = 0x6F703F3F,             // 'op??'
    kAudioConverterErr_PropertyNotSupported = 0x70726F70,              // 'prop'
    kAudioConverterErr_InvalidInputSize = 0x696E737A,                  // 'insz'
    kAudioConverterErr_InvalidOutputSize = 0x6F74737A,                 // 'otsz'
    kAudioConverterErr_UnspecifiedError = 0x77686174,                  // 'what'
    kAudioConverterErr_BadPropertySizeError = 0x2173697A,              // '!siz'
    kAudioConverterErr_RequiresPacketDescriptionsError = 0x21706B64,   // '!pkd'
    kAudioConverterErr_InputSampleRateOutOfRange = 0x21697372,         // '!isr'
    kAudioConverterErr_OutputSampleRateOutOfRange = 0x216F7372,        // '!osr'
};

// Asked for input: set `*ioNumberDataPackets` to the packets supplied (0 ends the
// stream), point `ioData`'s buffer at them and, for AAC input, describe them.
typedef OSStatus (*AudioConverterComplexInputDataProc)(AudioConverterRef inAudioConverter,
                                                       UInt32* ioNumberDataPackets, AudioBufferList* ioData,
                                                       AudioStreamPacketDescription** outDataPacketDescription,
                                                       void* inUserData);

// Supported: MPEG-4 AAC-LC to linear PCM and linear PCM to AAC-LC, where the PCM is
// interleaved signed 16-bit host-endian with the AAC side's channel count and rate.
OSStatus AudioConverterNew(const AudioStreamBasicDescription* inSourceFormat,
                           const AudioStreamBasicDescription* inDestinationFormat,
                           AudioConverterRef* outAudioConverter);
OSStatus AudioConverterDispose(AudioConverterRef inAudioConverter);
OSStatus AudioConverterGetProperty(AudioConverterRef inAudioConverter, AudioConverterPropertyID inPropertyID,
                                   UInt32* ioPropertyDataSize, void* outPropertyData);
OSStatus AudioConverterSetProperty(AudioConverterRef inAudioConverter, AudioConverterPropertyID inPropertyID,
                                   UInt32 inPropertyDataSize, const void* inPropertyData);
// `*ioOutputDataPacketSize`: packets wanted in, packets delivered out (frames for PCM).
OSStatus AudioConverterFillComplexBuffer(AudioConverterRef inAudioConverter,
                                         AudioConverterComplexInputDataProc inInputDataProc,
                                         void* inInputDataProcUserData, UInt32* ioOutputDataPacketSize,
                                         AudioBufferList* outOutputData,
                                         AudioStreamPacketDescription* outPacketDescription);

#ifdef __cplusplus
}
#endif

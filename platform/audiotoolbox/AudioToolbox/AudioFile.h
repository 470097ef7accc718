// Read-only audio file access, as far as a movie's sound priming is concerned.
#pragma once

#include <CoreAudioTypes/CoreAudioTypes.h>
#include <CoreFoundation/CoreFoundation.h>

#ifdef __cplusplus
extern "C" {
#endif

typedef struct OpaqueAudioFileID* AudioFileID;
typedef UInt32 AudioFileTypeID;
typedef UInt32 AudioFilePropertyID;

typedef enum AudioFilePermissions {
    kAudioFileReadPermission = 0x01,
    kAudioFileWritePermission = 0x02,
    kAudioFileReadWritePermission = 0x03,
} AudioFilePermissions;

enum {
    kAudioFileMPEG4Type = 0x6D703466,  // 'mp4f'
    kAudioFileM4AType = 0x6D346166,    // 'm4af'
};

enum {
    kAudioFilePropertyPacketTableInfo = 0x706E666F,  // 'pnfo'
};

enum {
    kAudioFileUnspecifiedError = 0x7768743F,             // 'wht?'
    kAudioFileUnsupportedFileTypeError = 0x7479703F,     // 'typ?'
    kAudioFileUnsupportedDataFormatError = 0x666D743F,   // 'fmt?'
    kAudioFileUnsupportedPropertyError = 0x7074793F,     // 'pty?'
    kAudioFileBadPropertySizeError = 0x2173697A,         // '!siz'
    kAudioFilePermissionsError = 0x70726D3F,             // 'prm?'
    kAudioFileInvalidFileError = 0x6474613F,             // 'dta?'
    kAudioFileOperationNotSupportedError = 0x6F703F3F,   // 'op??'
    kAudioFileNotOpenError = -38,
    kAudioFileFileNotFoundError = -43,
};

// Frames of the track: those that play, those the encoder primed before them, and
// those it appended after them.
typedef struct AudioFilePacketTableInfo {
    SInt64 mNumberValidFrames;
    SInt32 mPrimingFrames;
    SInt32 mRemainderFrames;
} AudioFilePacketTableInfo;

// Opens a QuickTime or MPEG-4 movie with a sound track; only read permission is offered.
OSStatus AudioFileOpenURL(CFURLRef inFileRef, AudioFilePermissions inPermissions, AudioFileTypeID inFileTypeHint,
                          AudioFileID* outAudioFile);
OSStatus AudioFileGetProperty(AudioFileID inAudioFile, AudioFilePropertyID inPropertyID, UInt32* ioDataSize,
                              void* outPropertyData);
OSStatus AudioFileClose(AudioFileID inAudioFile);

#ifdef __cplusplus
}
#endif

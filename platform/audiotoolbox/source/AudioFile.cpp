// The audio file entry points: a movie opened read-only, its sound track's packet table.
#include <AudioToolbox/AudioFile.h>

#include "CFURLObject.h"
#include "MovieSoundTiming.h"

#include <cstring>
#include <new>

struct OpaqueAudioFileID {
    AudioFilePacketTableInfo packetTable{};
};

OSStatus AudioFileOpenURL(CFURLRef inFileRef, AudioFilePermissions inPermissions, AudioFileTypeID /*inFileTypeHint*/,
                          AudioFileID* outAudioFile)
{
    if (inFileRef == nullptr || outAudioFile == nullptr) {
        return kAudio_ParamError;
    }
    *outAudioFile = nullptr;
    if (inPermissions != kAudioFileReadPermission) {
        return kAudioFileOperationNotSupportedError;
    }
    try {
        atcompat::SoundTrackTiming timing;
        const OSStatus status = atcompat::ReadSoundTrackTiming(inFileRef->m_path, &timing);
        if (status != noErr) {
            return status;
        }
        // Owned by the caller until AudioFileClose.
        *outAudioFile = new OpaqueAudioFileID{{timing.validFrames, timing.primingFrames, timing.remainderFrames}};
        return noErr;
    } catch (const std::bad_alloc&) {
        return kAudio_MemFullError;
    }
}

OSStatus AudioFileGetProperty(AudioFileID inAudioFile, AudioFilePropertyID inPropertyID, UInt32* ioDataSize,
                              void* outPropertyData)
{
    if (inAudioFile == nullptr || ioDataSize == nullptr || outPropertyData == nullptr) {
        return kAudio_ParamError;
    }
    if (inPropertyID != kAudioFilePropertyPacketTableInfo) {
        return kAudioFileUnsupportedPropertyError;
    }
    if (*ioDataSize < sizeof(AudioFilePacketTableInfo)) {
        return kAudioFileBadPropertySizeError;
    }
    std::memcpy(outPropertyData, &inAudioFile->packetTable, sizeof inAudioFile->packetTable);
    *ioDataSize = sizeof(AudioFilePacketTableInfo);
    return noErr;
}

OSStatus AudioFileClose(AudioFileID inAudioFile)
{
    if (inAudioFile == nullptr) {
        return kAudioFileNotOpenError;
    }
    delete inAudioFile;
    return noErr;
}

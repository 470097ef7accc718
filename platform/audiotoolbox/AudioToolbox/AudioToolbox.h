// Umbrella header of the audio toolbox subset: converter and audio file.
#pragma once

#include <AudioToolbox/AudioConverter.h>
#include <AudioToolbox/AudioFile.h>
#include <CoreAudioTypes/CoreAudioTypes.h>

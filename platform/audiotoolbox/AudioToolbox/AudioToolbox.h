// Umbrella header of the audio toolbox subset: the converter.
#pragma once

#include <AudioToolbox/AudioConverter.h>
#include <CoreAudioTypes/CoreAudioTypes.h>

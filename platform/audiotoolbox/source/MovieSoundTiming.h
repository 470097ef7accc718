// Reads, from a QuickTime or MPEG-4 movie, how the first sound track's frames divide
// into priming, played frames and remainder: what an audio file reports as its packet
// table for such a movie.
#pragma once

#include <MacTypes.h>

#include <cstdint>
#include <string>

namespace atcompat {

struct SoundTrackTiming {
    int64_t validFrames = 0;
    int32_t primingFrames = 0;
    int32_t remainderFrames = 0;
};

// The priming is the media time where the track's first non-empty edit starts, in the
// sound media's time scale, which is its sample rate; without an edit list it is 0.
// Fails with an audio file status: missing, unreadable, malformed, or no sound track.
OSStatus ReadSoundTrackTiming(const std::string& path, SoundTrackTiming* timing);

}  // namespace atcompat

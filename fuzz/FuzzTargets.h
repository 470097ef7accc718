// The fuzzed entry points, shared by the libFuzzer programs and the replay of kept inputs.
#pragma once

#include <cstddef>
#include <cstdint>

namespace fuzztarget {

// Each target returns 0, or one of these when a property it checks does not hold (the fuzzing
// programs then trap, the replay suite fails). The oldest targets abort instead.
enum Broken : int {
    kBrokenChunkList = 1,                 // chunks not numbered in order or not as long as their samples
    kWalksDisagree = 2,                   // the sound or video walk and the every-track walk differ
    kUnlistedPropertyAnswer = 3,          // the property query answered outside its documented codes
    kPropertyChangedItsMind = 4,          // asked twice about one file, it answered twice differently
    kSourceWritten = 5,                   // the source's bytes changed
    kRefusedWhatThePropertyAccepted = 6,  // the property query said 0, the job's start refused
    kOutputWithoutSuccess = 7,            // a destination without a finished job, or none after one
    kOutputNotMarkedProcessed = 8,        // a finished destination of our AF payload not called processed
};

// The atom tree parser with its acceptance rules, then every reading walk over what it built
// (sound format with its decoder configuration, sample tables, video chunks, trim tags through
// the tag cursor, AF and audio level blocks); chunk lists well formed, and the same from the
// sound or video walk as from the walk over every track.
int AtomTree(const uint8_t* data, size_t size);
// The tag cursor over a raw tag atom payload; every tag it yields, written back by the
// tag writer, must give the input's own bytes (aborts otherwise).
int TagCursor(const uint8_t* data, size_t size);
// The "esds" descriptor chain (version and flags included); a decoder configuration it
// accepts must lie inside the input (aborts otherwise), and is read as the splicing reads it.
// The input is a raw AAC frame too: its first window read, and filled out to a longer size,
// which must come out exactly that long (aborts otherwise).
int Esds(const uint8_t* data, size_t size);
// Every typed reader of the track atoms and the sound description over the input as a
// payload; what a table reader accepts must fit the input and write back as its bytes.
int TrackAtoms(const uint8_t* data, size_t size);
// The property query over a movie made of the input: a documented answer, the same when asked
// again, the file left as it was.
int Property(const uint8_t* data, size_t size);
// A whole job over a movie made of the input, through the real processing library: started
// whenever the property query accepted the movie, a destination exactly when the job finished,
// that destination read back as processed, the source left as it was.
int Job(const uint8_t* data, size_t size);

}  // namespace fuzztarget

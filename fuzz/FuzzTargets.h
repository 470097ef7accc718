// The fuzzed entry points, shared by the libFuzzer programs and the replay of kept inputs.
#pragma once

#include <cstddef>
#include <cstdint>

namespace fuzztarget {

// The atom tree parser with its acceptance rules, then every reading walk over what it built
// (sound format with its decoder configuration, sample tables, video chunks, trim tags through
// the tag cursor, AF and audio level blocks).
int AtomTree(const uint8_t* data, size_t size);
// The tag cursor over a raw tag atom payload; every tag it yields, written back by the
// tag writer, must give the input's own bytes (aborts otherwise).
int TagCursor(const uint8_t* data, size_t size);
// The "esds" descriptor chain (version and flags included); a decoder configuration it
// accepts must lie inside the input (aborts otherwise).
int Esds(const uint8_t* data, size_t size);
// Every typed reader of the track atoms and the sound description over the input as a
// payload; what a table reader accepts must fit the input and write back as its bytes.
int TrackAtoms(const uint8_t* data, size_t size);
// The property query over a movie made of the input.
int Property(const uint8_t* data, size_t size);
// A whole job over a movie made of the input, through the real processing library.
int Job(const uint8_t* data, size_t size);

}  // namespace fuzztarget

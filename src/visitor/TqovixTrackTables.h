// What one track's sample tables say, gathered by a walk and turned into a chunk
// list once the whole track has been read.
#pragma once

#include <cstdint>
#include <optional>
#include <vector>

#include "atom/TqovixSoundEntry.h"
#include "atom/TqovixTrackAtoms.h"
#include "visitor/TqovixChunkInformation.h"

struct TqovixTrackTables {
    uint32_t index = 0;  // among the movie's "trak" atoms, from 0
    std::optional<TqovixTrackAtoms::Handler> handler;
    std::optional<TqovixSoundEntry::Entry> soundEntry;  // for sound tracks; children not kept
    eTqovixAtomType format{};                           // first sample entry's format
    bool dataInFile = true;
    std::optional<std::vector<TqovixTrackAtoms::ChunkRun>> runs;
    std::optional<TqovixTrackAtoms::SampleSizes> sizes;
    std::optional<std::vector<uint64_t>> offsets;
    bool wideOffsets = false;
    // The first table whose payload could not be read.
    eTqovixErrorCode failure = eTqovixSuccess;

    bool IsHandler(const char (&subtype)[5]) const
    {
        return handler && TqovixTrackAtoms::IsMediaHandler(*handler, subtype);
    }
};

// Builds the chunk list; 4359 when the tables are missing or contradict each other.
// `frameBytes` non-zero marks uncompressed sound: a common sample size of 1 (the
// camera's convention) or of one frame both mean `frameBytes` per sample.
eTqovixErrorCode TqovixBuildChunkList(const TqovixTrackTables& tables, uint32_t frameBytes,
                                      std::vector<TqovixChunkInformation>& out);

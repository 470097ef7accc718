// Where the AAC encoder's packets go: an output buffer its owner may lend, and a
// procedure that receives each packet as soon as it is encoded.
#pragma once

#include "bridge/TqovixErrorCode.h"

struct ACEncoderStream {
    // Asked for a buffer of at least `size` bytes; null lets the encoder use its own.
    unsigned char* (*requestProc)(void* stream, unsigned int size) = nullptr;
    // One AAC packet; a failure code stops the encoding.
    eTqovixErrorCode (*resultProc)(void* stream, unsigned char* data, unsigned int size) = nullptr;
    unsigned char* buffer = nullptr;
    unsigned int bufferSize = 0;
    void* userData = nullptr;
};

// Results of the audio converter classes: internal result codes, so that they can be
// passed up unchanged.
#pragma once

#include <cstdint>

#include "bridge/TqovixErrorCode.h"

enum eConverterErrorCode : int32_t {
    eConverterSuccess = eTqovixSuccess,
    eConverterRefused = eTqovixErrorInvalidMovie,  // a format, size or property the converter refused
    eConverterFailed = eTqovixErrorGeneral,        // the converter failed without saying why
    eConverterInternal = eTqovixErrorInternal,     // no converter, or any other platform status
};

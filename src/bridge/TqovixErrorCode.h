// Internal result codes shared by every subsystem: below 4096 success or a
// state, 4096 and above failure.
#pragma once

#include <cstdint>

enum eTqovixErrorCode : int32_t {
    eTqovixSuccess = 0,
    eTqovixRunning = 1,
    eTqovixFinished = 2,

    eTqovixEnable = 17,
    eTqovixVerdict7 = 18,
    eTqovixVerdict8 = 19,
    eTqovixVerdict9 = 20,
    eTqovixVerdict20 = 153,
    eTqovixNoAudioLevel = 154,
    eTqovixVisitContinue = 155,
    eTqovixVisitSkip = 156,

    eTqovixErrorFirst = 4096,
    eTqovixErrorOutOfMemory = 4352,
    eTqovixErrorSourceNotFound = 4353,
    eTqovixErrorDestinationNotFound = 4354,
    eTqovixErrorSourceAccessDenied = 4355,
    eTqovixErrorDestinationAccessDenied = 4356,
    eTqovixErrorDiskFull = 4357,
    eTqovixErrorFileTooLarge = 4358,
    eTqovixErrorInvalidMovie = 4359,
    eTqovixErrorReserved = 4360,
    eTqovixErrorGeneral = 4361,
    eTqovixErrorAborted = 4608,

    eTqovixErrorEndOfFile = 8192,
    eTqovixErrorFileExists = 8193,
    eTqovixErrorTooManyFiles = 8194,
    eTqovixErrorIsDirectory = 8195,
    eTqovixErrorInvalidArgument = 8196,
    eTqovixErrorFileReserved1 = 8197,
    eTqovixErrorFileReserved2 = 8198,
    eTqovixErrorDevice = 12288,
    eTqovixErrorInternal = 36864,
};

constexpr bool TqovixFailed(int32_t code) { return code >= eTqovixErrorFirst; }

// The one table of result codes: each internal code beside the code hosts see (exported)
// and the processing library's, with the few rules on top of it. Every conversion between
// the three numberings reads this table.
#pragma once

#include "bridge/TqovixErrorCode.h"

namespace TqovixCodes {

inline constexpr int kNone = -1;

struct Row {
    eTqovixErrorCode internal;
    int exported;      // what the eight exported functions answer; kNone: 190
    long library;      // the processing library's number; kNone: none
    bool verdict;      // the library's number is a verdict on AF information, not a result
};

inline constexpr Row kRows[] = {
    {eTqovixSuccess, 0, 0, false},
    {eTqovixRunning, 0, kNone, false},
    {eTqovixFinished, 1, 0, false},
    {eTqovixEnable, 0, kNone, false},
    {eTqovixVerdict7, 7, 7, true},
    {eTqovixVerdict8, 8, 8, true},
    {eTqovixVerdict9, 9, 9, true},
    {eTqovixVerdict20, 20, 20, true},
    {eTqovixNoAudioLevel, kNone, 30, false},
    {eTqovixErrorOutOfMemory, 100, 100, false},
    {eTqovixErrorSourceNotFound, 110, 110, false},
    {eTqovixErrorDestinationNotFound, 111, 111, false},
    {eTqovixErrorSourceAccessDenied, 120, 120, false},
    {eTqovixErrorDestinationAccessDenied, 121, 121, false},
    {eTqovixErrorDiskFull, 130, 130, false},
    {eTqovixErrorFileTooLarge, 131, 131, false},
    {eTqovixErrorInvalidMovie, 8, kNone, false},
    {eTqovixErrorAborted, 200, 200, false},
};

inline constexpr int kGeneralExported = 190;
inline constexpr long kGeneralLibrary = 190;

// Internal to exported: 190 for anything without a row.
constexpr int Exported(eTqovixErrorCode code)
{
    for (const Row& row : kRows) {
        if (row.internal == code && row.exported != kNone) {
            return row.exported;
        }
    }
    return kGeneralExported;
}

// A host's answer to a progress notification: the failures it shares with us end the job
// with that reason; any other non-zero answer is a general failure.
constexpr eTqovixErrorCode FromHostAnswer(int answer)
{
    for (const Row& row : kRows) {
        if (TqovixFailed(row.internal) && row.library != kNone && row.exported == answer) {
            return row.internal;
        }
    }
    return eTqovixErrorGeneral;
}

// Internal to the processing library's: 190 for anything without a row.
constexpr unsigned long Library(eTqovixErrorCode code)
{
    for (const Row& row : kRows) {
        if (row.internal == code && row.library != kNone && !row.verdict) {
            return static_cast<unsigned long>(row.library);
        }
    }
    return kGeneralLibrary;
}

// The processing library's to internal; verdicts only where the answer may be one.
constexpr eTqovixErrorCode FromLibrary(unsigned long code, bool verdicts)
{
    for (const Row& row : kRows) {
        if (row.library != kNone && static_cast<unsigned long>(row.library) == code && row.verdict == verdicts) {
            return row.internal;
        }
    }
    return verdicts ? FromLibrary(code, false) : eTqovixErrorGeneral;
}

// A walk or a query that stopped with the library's verdict on the AF information (or its
// acceptance), which callers pass on rather than take as "found".
constexpr bool IsVerdict(int32_t code) { return code >= eTqovixEnable && code <= eTqovixVerdict20; }

}  // namespace TqovixCodes

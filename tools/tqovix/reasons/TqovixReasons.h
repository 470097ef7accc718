/* Why a job or a query failed, for hosts that are not the tqovix tool (the Python module):
   the tool's own reasons, with their stable keys and words. Not part of the library's
   interface; loaded beside it. Call it while no session of the library is open: to tell a
   processed movie it opens and closes the processing library itself. */
#ifndef TQOVIXREASONS_H
#define TQOVIXREASONS_H

#include <stddef.h>

#ifdef __cplusplus
extern "C" {
#endif

#define TQOVIX_REASONS_EXPORT __attribute__((visibility("default")))

/* The reason behind the library's answer `code` for a job from `source` to `destination`
   (NULL or "": a property query). Writes the reason's key and words, cut to fit and always
   terminated; returns the exported code the reason stands for (0 when `code` is 0). */
TQOVIX_REASONS_EXPORT int TqovixExplain(int code, const char* source, const char* destination, char* key,
                                        size_t keySize, char* text, size_t textSize);
/* Whether a job may write `destination` before the library is asked: not the source
   itself, not a folder, and, unless `replace`, no file there. Returns 0 with key "none" when
   it may, else the reason's code (-1 for "destination-exists": no exported code says it). */
TQOVIX_REASONS_EXPORT int TqovixCheckDestination(const char* source, const char* destination, int replace,
                                                 char* key, size_t keySize, char* text, size_t textSize);
/* The words of the reason with this key, without a detail; returns its code (-1: none), or
   -2 for a key that names no reason. For hosts that find a reason themselves (a name taken
   while the job ran) and word it as the tool does. */
TQOVIX_REASONS_EXPORT int TqovixReasonWords(const char* key, char* text, size_t textSize);
/* 1 when the reason with this key is about the destination rather than the source. */
TQOVIX_REASONS_EXPORT int TqovixAboutDestination(const char* key);

#ifdef __cplusplus
}
#endif

#endif

/* The library's public interface: initialise once, query a movie, start one job at a
   time and poll or be called back, abort, close. Results are the small exported codes. */
#ifndef TQOVIXUTILITY_H
#define TQOVIXUTILITY_H

#ifdef __cplusplus
extern "C" {
#endif

#define TQOVIX_EXPORT __attribute__((visibility("default")))

TQOVIX_EXPORT int TqInitializeOVIX(void);
TQOVIX_EXPORT void TqCloseOVIX(void);
TQOVIX_EXPORT int TqGetPropertyOVIX(const char* path);
TQOVIX_EXPORT int TqSetCallBackNotifyProgressOVIX(int (*callback)(int, int));
TQOVIX_EXPORT int TqExecuteOVIX(const char* sourcePath, const char* destinationPath);
TQOVIX_EXPORT int TqIsFinishedOVIX(void);
TQOVIX_EXPORT void TqAbortOVIX(void);
TQOVIX_EXPORT int TqGetProgressOVIX(int* first, int* second);

#ifdef __cplusplus
}
#endif

#endif

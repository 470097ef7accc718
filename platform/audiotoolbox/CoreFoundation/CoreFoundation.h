// The few CoreFoundation calls the audio file interface needs: file URLs made from
// paths, and reference-counted release.
#pragma once

#include <MacTypes.h>

#ifdef __cplusplus
extern "C" {
#endif

typedef const void* CFTypeRef;
typedef const struct __CFAllocator* CFAllocatorRef;
typedef const struct __CFURL* CFURLRef;
typedef long CFIndex;

// The default allocator is the null allocator, as on the platform.
#define kCFAllocatorDefault ((CFAllocatorRef)0)

// A file URL for `bufLen` bytes of a path; relative paths are resolved against the
// current directory now, not when the URL is used. Null for an empty or null path.
CFURLRef CFURLCreateFromFileSystemRepresentation(CFAllocatorRef allocator, const UInt8* buffer, CFIndex bufLen,
                                                 Boolean isDirectory);
CFTypeRef CFRetain(CFTypeRef cf);
void CFRelease(CFTypeRef cf);

#ifdef __cplusplus
}
#endif

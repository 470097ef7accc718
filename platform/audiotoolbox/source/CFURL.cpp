#include "CFURLObject.h"

#include <cstring>
#include <filesystem>
#include <new>

CFURLRef CFURLCreateFromFileSystemRepresentation(CFAllocatorRef /*allocator*/, const UInt8* buffer, CFIndex bufLen,
                                                 Boolean /*isDirectory*/)
{
    if (buffer == nullptr || bufLen <= 0 || std::memchr(buffer, 0, static_cast<size_t>(bufLen)) != nullptr) {
        return nullptr;
    }
    try {
        std::error_code error;
        const std::filesystem::path absolute =
            std::filesystem::absolute(std::string(reinterpret_cast<const char*>(buffer), static_cast<size_t>(bufLen)),
                                      error);
        if (error) {
            return nullptr;
        }
        // Released by CFRelease when the last reference goes.
        return new __CFURL(absolute.string());
    } catch (const std::bad_alloc&) {
        return nullptr;
    }
}

CFTypeRef CFRetain(CFTypeRef cf)
{
    if (cf != nullptr) {
        static_cast<const __CFURL*>(cf)->m_references.fetch_add(1, std::memory_order_relaxed);
    }
    return cf;
}

void CFRelease(CFTypeRef cf)
{
    if (cf == nullptr) {
        return;
    }
    const auto* url = static_cast<const __CFURL*>(cf);
    if (url->m_references.fetch_sub(1, std::memory_order_acq_rel) == 1) {
        delete url;
    }
}

// What a CFURLRef points at: a file URL as the absolute path it names. It is the only
// CoreFoundation type of this subset, so CFRelease knows what it releases.
#pragma once

#include <CoreFoundation/CoreFoundation.h>

#include <atomic>
#include <string>

struct __CFURL {
    explicit __CFURL(std::string path) : m_path(std::move(path)) {}

    const std::string m_path;
    mutable std::atomic<long> m_references{1};
};

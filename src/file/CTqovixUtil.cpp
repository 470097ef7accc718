#include "file/CTqovixUtil.h"

#include <cstring>
#include <sys/stat.h>

void CTqovixUtil::_memcpy(void* destination, unsigned long destinationSize, const void* source, unsigned long size)
{
    (void)destinationSize;
    // Empty buffers may hand over null pointers, which memcpy must never see.
    if (size == 0) {
        return;
    }
    std::memcpy(destination, source, size);
}

bool CTqovixUtil::IsSameFile(const char* pathA, const char* pathB)
{
    if (pathA == nullptr || pathB == nullptr) {
        return false;
    }
    struct stat statusA {};
    struct stat statusB {};
    if (stat(pathA, &statusA) != 0 || stat(pathB, &statusB) != 0) {
        return false;
    }
    return statusA.st_dev == statusB.st_dev && statusA.st_ino == statusB.st_ino;
}

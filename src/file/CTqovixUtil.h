// Small helpers that do not belong to one file object.
#pragma once

class CTqovixUtil {
public:
    // destinationSize is not checked: the caller guarantees that size fits.
    static void _memcpy(void* destination, unsigned long destinationSize, const void* source, unsigned long size);

    // True when both paths name one existing file, however they are spelled
    // (relative or absolute, through links). The controller refuses such a job
    // because creating the destination would truncate the source.
    static bool IsSameFile(const char* pathA, const char* pathB);
};

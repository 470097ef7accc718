// The one allocation policy: every allocation whose size a file or the processing library
// controls goes through TqovixAllocate, so that running out of memory is a result code
// (4352), never an exception that would cross into the host.
#pragma once

#include <new>
#include <stdexcept>

#include "bridge/TqovixErrorCode.h"

template <typename Allocate>
eTqovixErrorCode TqovixAllocate(Allocate&& allocate) noexcept
{
    try {
        allocate();
    } catch (const std::bad_alloc&) {
        return eTqovixErrorOutOfMemory;
    } catch (const std::length_error&) {
        return eTqovixErrorOutOfMemory;
    }
    return eTqovixSuccess;
}

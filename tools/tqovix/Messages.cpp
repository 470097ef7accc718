#include "Commands.h"

#include "bridge/TqovixErrorCode.h"

std::string DescribeInternalCode(int code)
{
    switch (code) {
    case eTqovixSuccess: return "success";
    case eTqovixErrorOutOfMemory: return "out of memory";
    case eTqovixErrorSourceNotFound: return "file not found";
    case eTqovixErrorDestinationNotFound: return "destination directory not found";
    case eTqovixErrorSourceAccessDenied: return "access to the file denied";
    case eTqovixErrorDestinationAccessDenied: return "access to the destination denied";
    case eTqovixErrorDiskFull: return "not enough free space on the destination volume";
    case eTqovixErrorFileTooLarge: return "the destination file system cannot hold a file that large";
    case eTqovixErrorInvalidMovie: return "not a camera movie, or its atom structure is malformed";
    case eTqovixErrorAborted: return "aborted";
    case eTqovixErrorEndOfFile: return "end of file met while writing";
    case eTqovixErrorIsDirectory: return "the path is a directory";
    case eTqovixErrorInvalidArgument: return "invalid argument or file too large";
    case eTqovixErrorDevice: return "device error";
    default: return code >= eTqovixErrorFirst ? "unexpected failure" : "state";
    }
}

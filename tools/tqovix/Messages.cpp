#include <cstdio>

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

std::string DescribeResult(int code)
{
    switch (code) {
    case 0: return "success";
    case 7:
    case 9: return "the processing library cannot use its AF information";
    case 8: return "no AF information, or not a camera movie the library accepts";
    case 20: return "already processed";
    case 100: return "out of memory";
    case 110: return "file not found";
    case 111: return "destination directory not found";
    case 120: return "access to the file denied";
    case 121: return "access to the destination denied";
    case 130: return "not enough free space on the destination volume";
    case 131: return "the destination file system cannot hold a file that large";
    case 190: return "not a movie file or an internal error";
    case 200: return "aborted";
    default: return "unexpected result " + std::to_string(code);
    }
}

std::string JsonString(const std::string& text)
{
    std::string quoted = "\"";
    for (const char c : text) {
        switch (c) {
        case '"': quoted += "\\\""; break;
        case '\\': quoted += "\\\\"; break;
        case '\n': quoted += "\\n"; break;
        case '\t': quoted += "\\t"; break;
        default:
            if (static_cast<unsigned char>(c) < 0x20) {
                char escaped[8];
                std::snprintf(escaped, sizeof escaped, "\\u%04x", static_cast<unsigned>(c));
                quoted += escaped;
            } else {
                quoted += c;
            }
        }
    }
    return quoted + "\"";
}

#include "MovieSoundTiming.h"

#include <AudioToolbox/AudioFile.h>

#include <cerrno>
#include <fcntl.h>
#include <initializer_list>
#include <limits>
#include <optional>
#include <sys/stat.h>
#include <unistd.h>
#include <vector>

namespace atcompat {

namespace {

// A movie atom beyond this is not a camera movie's; reading it would only risk memory.
constexpr uint64_t kMaxMovieAtomSize = 256ULL << 20;

constexpr uint32_t Type(const char (&name)[5])
{
    return (uint32_t{static_cast<uint8_t>(name[0])} << 24) | (uint32_t{static_cast<uint8_t>(name[1])} << 16) |
           (uint32_t{static_cast<uint8_t>(name[2])} << 8) | uint32_t{static_cast<uint8_t>(name[3])};
}

uint32_t Be32(const uint8_t* p)
{
    return (uint32_t{p[0]} << 24) | (uint32_t{p[1]} << 16) | (uint32_t{p[2]} << 8) | uint32_t{p[3]};
}

uint64_t Be64(const uint8_t* p)
{
    return (uint64_t{Be32(p)} << 32) | Be32(p + 4);
}

struct Span {
    const uint8_t* data = nullptr;
    size_t size = 0;
};

class FileDescriptor {
public:
    explicit FileDescriptor(int descriptor) : m_descriptor(descriptor) {}
    ~FileDescriptor()
    {
        if (m_descriptor >= 0) {
            close(m_descriptor);
        }
    }
    FileDescriptor(const FileDescriptor&) = delete;
    FileDescriptor& operator=(const FileDescriptor&) = delete;
    int Get() const { return m_descriptor; }

private:
    int m_descriptor;
};

bool ReadAt(int descriptor, uint64_t offset, void* buffer, size_t size)
{
    auto* bytes = static_cast<uint8_t*>(buffer);
    while (size > 0) {
        const ssize_t count = pread(descriptor, bytes, size, static_cast<off_t>(offset));
        if (count < 0 && errno == EINTR) {
            continue;
        }
        if (count <= 0) {
            return false;
        }
        bytes += count;
        offset += static_cast<uint64_t>(count);
        size -= static_cast<size_t>(count);
    }
    return true;
}

// Walks the atoms inside one payload. A malformed header ends the walk and marks it.
class AtomWalk {
public:
    explicit AtomWalk(Span parent) : m_parent(parent) {}

    bool Next(uint32_t* type, Span* payload)
    {
        if (m_bMalformed || m_parent.size - m_position < 8) {
            return false;
        }
        const uint8_t* header = m_parent.data + m_position;
        const size_t left = m_parent.size - m_position;
        uint64_t size = Be32(header);
        size_t headerSize = 8;
        if (size == 1) {
            if (left < 16) {
                m_bMalformed = true;
                return false;
            }
            size = Be64(header + 8);
            headerSize = 16;
        } else if (size == 0) {
            size = left;
        }
        if (size < headerSize || size > left) {
            m_bMalformed = true;
            return false;
        }
        *type = Be32(header + 4);
        *payload = Span{header + headerSize, static_cast<size_t>(size) - headerSize};
        m_position += static_cast<size_t>(size);
        return true;
    }

    std::optional<Span> Find(uint32_t wanted)
    {
        uint32_t type = 0;
        Span payload;
        while (Next(&type, &payload)) {
            if (type == wanted) {
                return payload;
            }
        }
        return std::nullopt;
    }

    bool Malformed() const { return m_bMalformed; }

private:
    Span m_parent;
    size_t m_position = 0;
    bool m_bMalformed = false;
};

std::optional<Span> FindPath(Span parent, std::initializer_list<uint32_t> path)
{
    std::optional<Span> current = parent;
    for (uint32_t type : path) {
        current = AtomWalk(*current).Find(type);
        if (!current) {
            return std::nullopt;
        }
    }
    return current;
}

// The time scale of a "mvhd" or "mdhd" payload: both put it after the two dates. 0 when
// the payload is too short, which is no valid time scale either.
uint32_t TimeScale(Span header)
{
    if (header.size < 4) {
        return 0;
    }
    const size_t offset = header.data[0] == 1 ? 20 : 12;
    return header.size < offset + 4 ? 0 : Be32(header.data + offset);
}

bool MediaDuration(Span stts, uint64_t* duration)
{
    if (stts.size < 8) {
        return false;
    }
    const uint64_t count = Be32(stts.data + 4);
    if (count > (stts.size - 8) / 8) {
        return false;
    }
    unsigned __int128 total = 0;
    for (uint64_t i = 0; i < count; ++i) {
        const uint8_t* entry = stts.data + 8 + i * 8;
        total += static_cast<unsigned __int128>(Be32(entry)) * Be32(entry + 4);
    }
    if (total > std::numeric_limits<int64_t>::max()) {
        return false;
    }
    *duration = static_cast<uint64_t>(total);
    return true;
}

struct Edit {
    uint64_t segmentDuration = 0;  // movie time scale
    int64_t mediaTime = 0;         // media time scale
};

// The first edit that shows media; an empty edit (media time -1) only delays the track.
std::optional<Edit> FirstMediaEdit(Span elst, bool* malformed)
{
    if (elst.size < 8) {
        *malformed = true;
        return std::nullopt;
    }
    const bool wide = elst.data[0] == 1;
    const size_t entrySize = wide ? 20 : 12;
    const uint64_t count = Be32(elst.data + 4);
    if (count > (elst.size - 8) / entrySize) {
        *malformed = true;
        return std::nullopt;
    }
    for (uint64_t i = 0; i < count; ++i) {
        const uint8_t* entry = elst.data + 8 + i * entrySize;
        Edit edit;
        edit.segmentDuration = wide ? Be64(entry) : Be32(entry);
        edit.mediaTime = wide ? static_cast<int64_t>(Be64(entry + 8)) : static_cast<int32_t>(Be32(entry + 4));
        if (edit.mediaTime != -1) {
            return edit;
        }
    }
    return std::nullopt;
}

OSStatus TimingOfTrack(Span trak, uint32_t movieTimeScale, SoundTrackTiming* timing)
{
    const std::optional<Span> mdhd = FindPath(trak, {Type("mdia"), Type("mdhd")});
    const std::optional<Span> stts = FindPath(trak, {Type("mdia"), Type("minf"), Type("stbl"), Type("stts")});
    const uint32_t mediaTimeScale = mdhd ? TimeScale(*mdhd) : 0;
    uint64_t total = 0;
    if (mediaTimeScale == 0 || !stts || !MediaDuration(*stts, &total)) {
        return kAudioFileInvalidFileError;
    }

    std::optional<Edit> edit;
    if (const std::optional<Span> elst = FindPath(trak, {Type("edts"), Type("elst")})) {
        bool malformed = false;
        edit = FirstMediaEdit(*elst, &malformed);
        if (malformed) {
            return kAudioFileInvalidFileError;
        }
    }
    const int64_t priming = edit ? edit->mediaTime : 0;
    if (priming < 0 || priming > std::numeric_limits<int32_t>::max()) {
        return kAudioFileInvalidFileError;
    }
    const uint64_t afterPriming = total > static_cast<uint64_t>(priming) ? total - priming : 0;
    uint64_t valid = afterPriming;
    if (edit && movieTimeScale > 0) {
        const unsigned __int128 shown =
            static_cast<unsigned __int128>(edit->segmentDuration) * mediaTimeScale / movieTimeScale;
        valid = shown < afterPriming ? static_cast<uint64_t>(shown) : afterPriming;
    }
    const uint64_t remainder = afterPriming - valid;
    timing->primingFrames = static_cast<int32_t>(priming);
    timing->validFrames = static_cast<int64_t>(valid);
    timing->remainderFrames = static_cast<int32_t>(
        remainder > static_cast<uint64_t>(std::numeric_limits<int32_t>::max()) ? std::numeric_limits<int32_t>::max()
                                                                              : remainder);
    return noErr;
}

OSStatus OpenStatus(int error)
{
    switch (error) {
    case ENOENT:
    case ENOTDIR:
        return kAudioFileFileNotFoundError;
    case EACCES:
    case EPERM:
        return kAudioFilePermissionsError;
    default:
        return kAudioFileUnspecifiedError;
    }
}

}  // namespace

OSStatus ReadSoundTrackTiming(const std::string& path, SoundTrackTiming* timing)
{
    const FileDescriptor file(open(path.c_str(), O_RDONLY | O_CLOEXEC));
    if (file.Get() < 0) {
        return OpenStatus(errno);
    }
    struct stat status {};
    if (fstat(file.Get(), &status) != 0 || !S_ISREG(status.st_mode) || status.st_size < 0) {
        return kAudioFileInvalidFileError;
    }
    const uint64_t fileSize = static_cast<uint64_t>(status.st_size);

    // Top-level atoms are walked on disk, so that media data is never read.
    uint64_t position = 0;
    std::vector<uint8_t> moov;
    bool found = false;
    while (!found && fileSize - position >= 8) {
        uint8_t header[16];
        if (!ReadAt(file.Get(), position, header, 8)) {
            return kAudioFileInvalidFileError;
        }
        uint64_t size = Be32(header);
        uint64_t headerSize = 8;
        if (size == 1) {
            if (fileSize - position < 16 || !ReadAt(file.Get(), position + 8, header + 8, 8)) {
                return kAudioFileInvalidFileError;
            }
            size = Be64(header + 8);
            headerSize = 16;
        } else if (size == 0) {
            size = fileSize - position;
        }
        if (size < headerSize || size > fileSize - position) {
            return kAudioFileInvalidFileError;
        }
        if (Be32(header + 4) == Type("moov")) {
            if (size - headerSize > kMaxMovieAtomSize) {
                return kAudioFileInvalidFileError;
            }
            moov.resize(static_cast<size_t>(size - headerSize));
            if (!ReadAt(file.Get(), position + headerSize, moov.data(), moov.size())) {
                return kAudioFileInvalidFileError;
            }
            found = true;
        }
        position += size;
    }
    if (!found) {
        return kAudioFileUnsupportedFileTypeError;
    }

    const Span movie{moov.data(), moov.size()};
    const std::optional<Span> mvhd = AtomWalk(movie).Find(Type("mvhd"));
    const uint32_t movieTimeScale = mvhd ? TimeScale(*mvhd) : 0;
    AtomWalk tracks(movie);
    uint32_t type = 0;
    Span trak;
    while (tracks.Next(&type, &trak)) {
        if (type != Type("trak")) {
            continue;
        }
        const std::optional<Span> hdlr = FindPath(trak, {Type("mdia"), Type("hdlr")});
        if (hdlr && hdlr->size >= 12 && Be32(hdlr->data + 8) == Type("soun")) {
            return TimingOfTrack(trak, movieTimeScale, timing);
        }
    }
    return tracks.Malformed() ? kAudioFileInvalidFileError : kAudioFileUnsupportedDataFormatError;
}

}  // namespace atcompat

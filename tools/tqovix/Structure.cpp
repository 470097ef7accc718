#include "Structure.h"

#include <cerrno>
#include <cstdio>
#include <cstring>
#include <memory>

#include "atom/TqovixAtomType.h"

namespace {

// A listing is for people; a file of a million tiny atoms is shown in part.
constexpr size_t kMaxAtoms = 100000;
constexpr int kMaxDepth = 32;

struct FileCloser {
    void operator()(FILE* file) const { std::fclose(file); }
};

uint64_t ReadBig(const unsigned char* bytes, int count)
{
    uint64_t value = 0;
    for (int i = 0; i < count; ++i) {
        value = value << 8 | bytes[i];
    }
    return value;
}

// What may stand first in a QuickTime or ISO movie.
bool IsTopLevelType(const std::string& type)
{
    for (const char* known : {"ftyp", "moov", "mdat", "wide", "free", "skip", "pnot", "uuid", "moof", "styp", "PICT"}) {
        if (type == known) {
            return true;
        }
    }
    return false;
}

class Walker {
public:
    Walker(FILE* file, Structure& structure) : m_file(file), m_structure(structure) {}

    // The atoms between `begin` and `end`; false once a fault or a read error ended the walk.
    bool Walk(uint64_t begin, uint64_t end, int depth, const std::string& container)
    {
        for (uint64_t offset = begin; offset < end;) {
            if (m_structure.atoms.size() >= kMaxAtoms) {
                return Fault("the listing stops after " + std::to_string(kMaxAtoms) + " atoms");
            }
            unsigned char header[16];
            if (end - offset < 8) {
                return Fault(std::to_string(end - offset) + " stray bytes at offset " + std::to_string(offset) +
                             Within(container));
            }
            if (!Read(offset, header, 8)) {
                return false;
            }
            uint64_t size = ReadBig(header, 4);
            uint64_t headerSize = 8;
            const std::string type = AtomTypeText(header + 4);
            if (size == 1) {
                if (end - offset < 16 || !Read(offset + 8, header + 8, 8)) {
                    return Fault("'" + type + "' at offset " + std::to_string(offset) + ": its 64-bit size is cut off");
                }
                size = ReadBig(header + 8, 8);
                headerSize = 16;
            }
            if (depth == 0 && offset == 0) {
                m_structure.atomic = IsTopLevelType(type);
            }
            if (depth == 0 && size >= headerSize && size > end - offset) {
                m_structure.wholeSize = offset + size;  // the file was cut short (a copy broken off)
            }
            if (size < headerSize || size > end - offset) {
                const std::string said = size == 0 ? "size 0 (to the end of the file)" : "size " + std::to_string(size);
                const std::string room = size < headerSize ? "smaller than its header"
                                                           : "only " + std::to_string(end - offset) + " bytes are left" +
                                                                 Within(container);
                return Fault("'" + type + "' at offset " + std::to_string(offset) + ": " + said + ", " +
                             room);
            }
            m_structure.atoms.push_back({offset, size, type, depth});
            if (depth == 0 && type == "ftyp" && m_structure.brand.empty() && size >= headerSize + 4) {
                unsigned char brand[4];
                if (Read(offset + headerSize, brand, 4)) {
                    m_structure.brand = AtomTypeText(brand);
                }
            }
            eTqovixAtomType code;
            std::memcpy(&code, header + 4, 4);
            if (IsContainerAtom(code) && size - headerSize >= 9) {
                if (depth + 1 >= kMaxDepth) {
                    return Fault("atoms nested deeper than " + std::to_string(kMaxDepth) + " levels");
                }
                if (!Walk(offset + headerSize, offset + size, depth + 1, type)) {
                    return false;
                }
            }
            offset += size;
        }
        return true;
    }

private:
    static std::string Within(const std::string& container)
    {
        return container.empty() ? " in the file" : " in its container '" + container + "'";
    }

    bool Read(uint64_t offset, unsigned char* bytes, size_t count)
    {
        if (fseeko(m_file, static_cast<off_t>(offset), SEEK_SET) != 0 || std::fread(bytes, 1, count, m_file) != count) {
            m_structure.systemError = std::ferror(m_file) ? std::strerror(errno) : "the file ended early";
            return false;
        }
        return true;
    }

    bool Fault(const std::string& words)
    {
        m_structure.fault = words;
        return false;
    }

    FILE* m_file;
    Structure& m_structure;
};

}  // namespace

std::string AtomTypeText(const unsigned char type[4])
{
    std::string text;
    for (int i = 0; i < 4; ++i) {
        const unsigned char c = type[i];
        if (c >= 0x20 && c < 0x7F) {
            text += static_cast<char>(c);
        } else if (c >= 0xA0) {
            // Latin-1 in UTF-8: "©" (0xA9) begins the user data tags.
            text += static_cast<char>(0xC0 | c >> 6);
            text += static_cast<char>(0x80 | (c & 0x3F));
        } else {
            text += '?';
        }
    }
    return text;
}

Structure ScanStructure(const std::string& path)
{
    Structure structure;
    const std::unique_ptr<FILE, FileCloser> file(std::fopen(path.c_str(), "rb"));
    if (file == nullptr || fseeko(file.get(), 0, SEEK_END) != 0) {
        structure.systemError = std::strerror(errno);
        return structure;
    }
    const off_t size = ftello(file.get());
    if (size < 0) {
        structure.systemError = std::strerror(errno);
        return structure;
    }
    structure.readable = true;
    structure.fileSize = static_cast<uint64_t>(size);
    Walker(file.get(), structure).Walk(0, structure.fileSize, 0, "");
    return structure;
}

bool StartsLikeMovie(const std::string& path)
{
    const std::unique_ptr<FILE, FileCloser> file(std::fopen(path.c_str(), "rb"));
    unsigned char header[8];
    return file != nullptr && std::fread(header, 1, sizeof header, file.get()) == sizeof header &&
           IsTopLevelType(AtomTypeText(header + 4));
}

std::string NonMovieKind(const std::string& path)
{
    const std::unique_ptr<FILE, FileCloser> file(std::fopen(path.c_str(), "rb"));
    unsigned char head[512];
    const size_t count = file == nullptr ? 0 : std::fread(head, 1, sizeof head, file.get());
    const auto starts = [&](const char* magic, size_t length) {
        return count >= length && std::memcmp(head, magic, length) == 0;
    };
    if (starts("\xFF\xD8\xFF", 3)) {
        return "a JPEG image";
    }
    if (starts("\x89PNG\r\n\x1A\n", 8)) {
        return "a PNG image";
    }
    // Most raw stills are TIFF underneath; the 16-bit magic is 42, or 43 for BigTIFF.
    if (starts("II*\0", 4) || starts("MM\0*", 4) || starts("II+\0", 4) || starts("MM\0+", 4)) {
        return "a TIFF image or raw still";
    }
    const size_t bom = starts("\xEF\xBB\xBF", 3) ? 3 : 0;
    if (count >= bom + 5 && std::memcmp(head + bom, "<?xml", 5) == 0) {
        return "an XML file (a sidecar)";
    }
    if (count == 0) {
        return {};
    }
    // Text: no control bytes besides white space. Bytes from 0x80 up are let pass, for UTF-8.
    for (size_t i = bom; i < count; ++i) {
        const unsigned char c = head[i];
        if (c < 0x20 && c != '\t' && c != '\n' && c != '\r' && c != '\f') {
            return {};
        }
    }
    return "plain text";
}

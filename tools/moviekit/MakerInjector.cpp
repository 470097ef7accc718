#include "MakerInjector.h"

#include "MoovBuilder.h"
#include "MoviePlan.h"

#include <fstream>
#include <iterator>

namespace moviekit {

namespace {

struct Box {
    std::string type;
    uint64_t offset = 0;
    uint64_t headerSize = 0;
    uint64_t size = 0;
};

uint64_t ReadBE(const Bytes& bytes, uint64_t offset, int width)
{
    uint64_t value = 0;
    for (int i = 0; i < width; ++i) {
        value = value << 8 | bytes[offset + i];
    }
    return value;
}

// The atoms between `begin` and `end`; false when one does not fit.
bool ReadBoxes(const Bytes& bytes, uint64_t begin, uint64_t end, std::vector<Box>& boxes)
{
    for (uint64_t offset = begin; offset < end;) {
        if (end - offset < 8) {
            return false;
        }
        Box box{std::string(bytes.begin() + static_cast<std::ptrdiff_t>(offset + 4),
                            bytes.begin() + static_cast<std::ptrdiff_t>(offset + 8)),
                offset, 8, ReadBE(bytes, offset, 4)};
        if (box.size == 1 && end - offset >= 16) {
            box.headerSize = 16;
            box.size = ReadBE(bytes, offset + 8, 8);
        } else if (box.size == 0) {
            box.size = end - offset;
        }
        if (box.size < box.headerSize || box.size > end - offset) {
            return false;
        }
        boxes.push_back(box);
        offset += box.size;
    }
    return true;
}

Bytes Slice(const Bytes& bytes, uint64_t offset, uint64_t size)
{
    return Bytes(bytes.begin() + static_cast<std::ptrdiff_t>(offset),
                 bytes.begin() + static_cast<std::ptrdiff_t>(offset + size));
}

}  // namespace

bool AddMakerData(const std::string& path, const MovieRecipe& recipe, uint64_t soundFrames, std::string* error)
{
    std::ifstream in(path, std::ios::binary);
    const Bytes file((std::istreambuf_iterator<char>(in)), std::istreambuf_iterator<char>());
    std::vector<Box> top;
    if (file.empty() || !ReadBoxes(file, 0, file.size(), top) || top.empty() || top.back().type != "moov") {
        return PlanFail(error, path + ": not a movie whose moov comes last");
    }
    const Box moov = top.back();
    std::vector<Box> children;
    if (!ReadBoxes(file, moov.offset + moov.headerSize, moov.offset + moov.size, children)) {
        return PlanFail(error, path + ": unreadable moov");
    }
    MoviePlan plan;
    plan.soundFrames = soundFrames;
    ResolveMaker(recipe, plan);
    // The new user data takes the maker containers first, then what the writer had put there.
    const Bytes made = UserData(recipe.maker, plan);
    std::vector<Bytes> kept;
    std::vector<Bytes> udtaChildren = {Slice(made, 8, made.size() - 8)};
    for (const Box& child : children) {
        if (child.type != "udta") {
            kept.push_back(Slice(file, child.offset, child.size));
            continue;
        }
        udtaChildren.push_back(Slice(file, child.offset + child.headerSize, child.size - child.headerSize));
    }
    kept.push_back(Atom("udta", Concat(udtaChildren)));
    Bytes out = Slice(file, 0, moov.offset);
    const Bytes newMoov = Container("moov", kept);
    out.insert(out.end(), newMoov.begin(), newMoov.end());
    std::ofstream write(path, std::ios::binary | std::ios::trunc);
    write.write(reinterpret_cast<const char*>(out.data()), static_cast<std::streamsize>(out.size()));
    return write.good() || PlanFail(error, path + ": cannot be written");
}

}  // namespace moviekit

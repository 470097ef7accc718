// tqovix inspect: the atom tree as the parser sees it.
#include <cinttypes>
#include <cstdio>

#include "Commands.h"
#include "atom/CTqovixAtomControl.h"
#include "atom/CTqovixContainerAtom.h"
#include "file/CTqovixFile.h"

namespace {

void PrintAtoms(const TqovixAtomList& atoms, uint64_t offset, int depth)
{
    for (const auto& atom : atoms) {
        const uint64_t size = atom->GetSize();
        std::printf("%12" PRIu64 " %12" PRIu64 "  %*s%s\n", offset, size, depth * 2, "",
                    TqovixAtomTypeName(atom->GetType()).c_str());
        if (const auto* container = dynamic_cast<const CTqovixContainerAtom*>(atom.get())) {
            const uint64_t headerSize = size - [&] {
                uint64_t total = 0;
                for (const auto& child : container->GetChildren()) {
                    total += child->GetSize();
                }
                return total;
            }();
            PrintAtoms(container->GetChildren(), offset + headerSize, depth + 1);
        }
        offset += size;
    }
}

}  // namespace

int InspectCommand(const Arguments& arguments)
{
    if (arguments.size() != 1 || arguments[0] == "--help") {
        std::fputs("usage: tqovix inspect FILE\n", arguments.size() == 1 ? stdout : stderr);
        return arguments.size() == 1 ? 0 : 2;
    }
    const char* path = arguments[0].c_str();
    CTqovixFile file;
    eTqovixErrorCode result = file.Open(path, 1);
    if (!TqovixFailed(result)) {
        CTqovixAtomControl tree;
        result = tree.Initialize(file);
        if (!TqovixFailed(result)) {
            TqovixAtomList atoms;
            tree.GetAtoms(atoms);
            std::printf("%s\n%12s %12s  %s\n", path, "offset", "size", "type");
            PrintAtoms(atoms, 0, 0);
            return 0;
        }
    }
    std::fprintf(stderr, "tqovix: %s: %s (code %d)\n", path, DescribeInternalCode(result).c_str(), result);
    return 1;
}

#include "atom/CTqovixAtomControl.h"

#include <cstring>

#include "atom/CTqovixContainerAtom.h"
#include "atom/CTqovixLeafAtom.h"
#include "atom/TqovixEndian.h"
#include "bridge/TqovixCodeTable.h"
#include "file/CTqovixFile.h"

namespace {

constexpr uint64_t kMaxFileTypeSize = 1 << 20;

struct ParseState {
    CTqovixFile& file;
    size_t atomCount = 0;
};

eTqovixErrorCode ReadExactly(CTqovixFile& file, uint8_t* buffer, unsigned int size)
{
    unsigned int readSize = 0;
    const eTqovixErrorCode result = file.Read(buffer, &readSize, size);
    if (TqovixFailed(result)) {
        return result;
    }
    return readSize == size ? eTqovixSuccess : eTqovixErrorInvalidMovie;
}

// Parses one atom, and everything inside it, from the current position; it
// must fit in `available` bytes (what is left of its parent or of the file).
// `occupied` receives the bytes it takes in the file, header included.
eTqovixErrorCode CreateAtomList(ParseState& state, std::shared_ptr<CTqovixAtom>& atom, uint64_t available,
                                int depth, uint64_t& occupied)
{
    if (++state.atomCount > CTqovixAtomControl::kMaxAtoms || available < 8) {
        return eTqovixErrorInvalidMovie;
    }
    uint8_t header[16] = {};
    eTqovixErrorCode result = ReadExactly(state.file, header, 8);
    if (TqovixFailed(result)) {
        return result;
    }
    const uint32_t sizeField = TqovixReadBE32(header);
    eTqovixAtomType type;
    std::memcpy(&type, header + 4, 4);

    uint64_t headerSize = 8;
    uint64_t totalSize = sizeField;
    if (sizeField == 1) {
        headerSize = 16;
        if (available < 16) {
            return eTqovixErrorInvalidMovie;
        }
        result = ReadExactly(state.file, header + 8, 8);
        if (TqovixFailed(result)) {
            return result;
        }
        totalSize = TqovixReadBE64(header + 8);
    }
    // Sizes of 0 ("to the end of the file") and below the header are refused;
    // so is any atom that runs past what contains it.
    if (totalSize < headerSize || totalSize > available) {
        return eTqovixErrorInvalidMovie;
    }
    uint64_t payload = totalSize - headerSize;
    const bool largeHeader = headerSize == 16;

    long long offset = 0;
    result = state.file.GetPosition(&offset);
    if (TqovixFailed(result)) {
        return result;
    }

    occupied = totalSize;
    // A container type with fewer than 9 payload bytes cannot hold a child with a payload.
    if (payload < 9 || !IsContainerAtom(type)) {
        atom = std::make_shared<CTqovixLeafAtom>(type, &state.file, offset, payload, largeHeader);
        return state.file.Seek(static_cast<long long>(payload), CTqovixFile::eTqovixSeekCurrent);
    }

    if (depth >= CTqovixAtomControl::kMaxDepth) {
        return eTqovixErrorInvalidMovie;
    }
    TqovixAtomList children;
    while (payload > 0) {
        std::shared_ptr<CTqovixAtom> child;
        uint64_t childSize = 0;
        result = CreateAtomList(state, child, payload, depth + 1, childSize);
        if (TqovixFailed(result)) {
            return result;
        }
        children.push_back(std::move(child));
        payload -= childSize;
    }
    atom = std::make_shared<CTqovixContainerAtom>(type, std::move(children), largeHeader);
    return eTqovixSuccess;
}

// Callers take a stop below 4096 as "done", except the codes a visitor uses
// to report a verdict.
eTqovixErrorCode TopLevelResult(eTqovixErrorCode result)
{
    if (TqovixCodes::IsVerdict(result) || TqovixFailed(result)) {
        return result;
    }
    return eTqovixSuccess;
}

}  // namespace

eTqovixErrorCode CTqovixAtomControl::Initialize(CTqovixFile& file)
{
    if (!file.IsOpened()) {
        return eTqovixErrorInternal;
    }
    eTqovixErrorCode result = file.Seek(0, CTqovixFile::eTqovixSeekBegin);
    if (TqovixFailed(result)) {
        return result;
    }
    long long fileSize = 0;
    result = file.GetFileSize(&fileSize);
    if (TqovixFailed(result)) {
        return result;
    }
    if (fileSize < 1) {
        return eTqovixErrorInvalidMovie;
    }

    ParseState state{file};
    auto remaining = static_cast<uint64_t>(fileSize);
    bool brandAccepted = false;
    TqovixAtomList atoms;
    while (remaining > 0) {
        std::shared_ptr<CTqovixAtom> atom;
        uint64_t occupied = 0;
        result = CreateAtomList(state, atom, remaining, 0, occupied);
        if (TqovixFailed(result)) {
            return result;
        }
        if (atom->GetType() == TqovixAtom::kFtyp) {
            // A file-type atom holds a few brands; a huge one is not worth loading to refuse.
            if (atom->GetDataSize() < 4 || atom->GetDataSize() > kMaxFileTypeSize) {
                break;
            }
            const uint8_t* brand = atom->GetData();
            if (brand == nullptr || (std::memcmp(brand, "mp42", 4) != 0 && std::memcmp(brand, "qt  ", 4) != 0)) {
                break;
            }
            brandAccepted = true;
            // Reading the brand moved the position; the next atom starts behind this one.
            result = file.Seek(static_cast<long long>(fileSize - remaining + occupied), CTqovixFile::eTqovixSeekBegin);
            if (TqovixFailed(result)) {
                return result;
            }
        }
        atoms.push_back(std::move(atom));
        remaining -= occupied;
    }
    if (!brandAccepted || remaining != 0) {
        return eTqovixErrorInvalidMovie;
    }
    m_atoms = std::move(atoms);
    return eTqovixSuccess;
}

eTqovixErrorCode CTqovixAtomControl::Analyze(CTqovixAtomVisitor& visitor) const
{
    if (m_atoms.empty()) {
        return eTqovixErrorGeneral;
    }
    for (const auto& atom : m_atoms) {
        const eTqovixErrorCode result = atom->Analyze(visitor, {});
        if (result != eTqovixVisitSkip) {
            return TopLevelResult(result);
        }
    }
    return eTqovixErrorInvalidMovie;
}

eTqovixErrorCode CTqovixAtomControl::Update(const CTqovixAtomVisitor& visitor) const
{
    if (m_atoms.empty()) {
        return eTqovixErrorGeneral;
    }
    for (const auto& atom : m_atoms) {
        const eTqovixErrorCode result = atom->Update(visitor, {});
        if (result != eTqovixVisitSkip) {
            return TopLevelResult(result);
        }
    }
    return eTqovixVisitSkip;
}

eTqovixErrorCode CTqovixAtomControl::GetAtoms(TqovixAtomList& atoms) const
{
    atoms = m_atoms;
    return eTqovixSuccess;
}

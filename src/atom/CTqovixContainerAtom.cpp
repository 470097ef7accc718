#include "atom/CTqovixContainerAtom.h"

#include <utility>

#include "atom/CTqovixAtomVisitor.h"

namespace {

bool IsWalkContinuation(eTqovixErrorCode code)
{
    return code == eTqovixVisitContinue || code == eTqovixVisitSkip;
}

}  // namespace

CTqovixContainerAtom::CTqovixContainerAtom(eTqovixAtomType type, TqovixAtomList children, bool largeHeader)
    : m_type(type), m_children(std::move(children)), m_bLargeHeader(largeHeader)
{
}

uint64_t CTqovixContainerAtom::GetSize() const
{
    uint64_t total = 0;
    for (const auto& child : m_children) {
        total += child->GetSize();
    }
    return SizeWithHeader(total, m_bLargeHeader);
}

eTqovixErrorCode CTqovixContainerAtom::Analyze(CTqovixAtomVisitor& visitor, const TqovixAtomPath& path) const
{
    TqovixAtomPath childPath = path;
    childPath.push_back(m_type);
    if (visitor.Analyze(childPath, *this) == eTqovixVisitSkip) {
        return eTqovixVisitSkip;
    }

    const CTqovixAtom* mediaFirst = nullptr;
    if (m_type == TqovixAtom::kTrak) {
        // The media subtree decides what a visitor wants from the rest of the track.
        visitor.SetNeedAnalyzeMediaTime(IsExistAtom(m_children, TqovixAtom::kEdts));
        for (const auto& child : m_children) {
            if (child->GetType() == TqovixAtom::kMdia) {
                mediaFirst = child.get();
                const eTqovixErrorCode result = child->Analyze(visitor, childPath);
                if (!IsWalkContinuation(result)) {
                    return result;
                }
                break;
            }
        }
    }

    for (const auto& child : m_children) {
        if (child.get() == mediaFirst) {
            continue;
        }
        const eTqovixErrorCode result = child->Analyze(visitor, childPath);
        if (!IsWalkContinuation(result)) {
            return result;
        }
    }
    const eTqovixErrorCode left = visitor.Leave(childPath, *this);
    return IsWalkContinuation(left) ? eTqovixVisitSkip : left;
}

eTqovixErrorCode CTqovixContainerAtom::Update(const CTqovixAtomVisitor& visitor, const TqovixAtomPath& path)
{
    TqovixAtomPath childPath = path;
    childPath.push_back(m_type);
    if (visitor.Update(childPath, *this) == eTqovixVisitSkip) {
        return eTqovixVisitSkip;
    }
    for (const auto& child : m_children) {
        const eTqovixErrorCode result = child->Update(visitor, childPath);
        if (!IsWalkContinuation(result)) {
            return result;
        }
    }
    const eTqovixErrorCode left = visitor.Leave(childPath, *this);
    return IsWalkContinuation(left) ? eTqovixVisitSkip : left;
}

eTqovixErrorCode CTqovixContainerAtom::Write(CTqovixFile& file) const
{
    eTqovixErrorCode result = WriteHeader(file, m_bLargeHeader);
    if (TqovixFailed(result)) {
        return result;
    }
    for (const auto& child : m_children) {
        result = child->Write(file);
        if (TqovixFailed(result)) {
            return result;
        }
    }
    return eTqovixSuccess;
}

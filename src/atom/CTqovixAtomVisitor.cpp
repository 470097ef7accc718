#include "atom/CTqovixAtomVisitor.h"

#include <algorithm>

bool CTqovixPathTarget::IsNecessary(const TqovixAtomPath& path, bool isLeaf) const
{
    if (isLeaf) {
        return path == m_target;
    }
    return path.size() < m_target.size() && std::equal(path.begin(), path.end(), m_target.begin());
}

eTqovixErrorCode CTqovixPathTarget::ContainerAnswer(const TqovixAtomPath& path) const
{
    return IsNecessary(path, false) ? eTqovixVisitContinue : eTqovixVisitSkip;
}

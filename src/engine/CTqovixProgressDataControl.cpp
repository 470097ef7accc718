#include "engine/CTqovixProgressDataControl.h"

void CTqovixProgressDataControl::SetProgress(unsigned long first, unsigned long second)
{
    CTqovixLock lock(m_criticalSection);
    if (m_eResult.load() == eTqovixFinished) {
        m_progressFirst = 0;
        m_progressSecond = 0;
        return;
    }
    m_progressFirst = static_cast<int32_t>(static_cast<uint32_t>(first));
    m_progressSecond = static_cast<int32_t>(static_cast<uint32_t>(second));
}

eTqovixErrorCode CTqovixProgressDataControl::GetProgress(int* first, int* second) const
{
    CTqovixLock lock(m_criticalSection);
    if (first != nullptr) {
        *first = m_progressFirst;
    }
    if (second != nullptr) {
        *second = m_progressSecond;
    }
    return eTqovixSuccess;
}

void CTqovixProgressDataControl::Reset()
{
    CTqovixLock lock(m_criticalSection);
    m_progressFirst = 0;
    m_progressSecond = 0;
}

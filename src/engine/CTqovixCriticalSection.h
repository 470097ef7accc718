// The system's one lock: a thin owner of a non-recursive mutex.
#pragma once

#include <pthread.h>

class CTqovixCriticalSection {
public:
    CTqovixCriticalSection() { pthread_mutex_init(&m_mutex, nullptr); }
    ~CTqovixCriticalSection() { pthread_mutex_destroy(&m_mutex); }
    CTqovixCriticalSection(const CTqovixCriticalSection&) = delete;
    CTqovixCriticalSection& operator=(const CTqovixCriticalSection&) = delete;

    int Enter() { return pthread_mutex_lock(&m_mutex); }
    int Leave() { return pthread_mutex_unlock(&m_mutex); }

private:
    pthread_mutex_t m_mutex;
};

// Holds the lock for a scope.
class CTqovixLock {
public:
    explicit CTqovixLock(CTqovixCriticalSection& section) : m_section(section) { m_section.Enter(); }
    ~CTqovixLock() { m_section.Leave(); }
    CTqovixLock(const CTqovixLock&) = delete;
    CTqovixLock& operator=(const CTqovixLock&) = delete;

private:
    CTqovixCriticalSection& m_section;
};

#include "umutex.h"

lock_error::lock_error() : std::runtime_error("thread lock error") {}
lock_error::~lock_error() = default;

thread_resource_error::thread_resource_error() : std::runtime_error("thread resource error") {}
thread_resource_error::~thread_resource_error() = default;

mutex::mutex()
{
    if (pthread_mutex_init(&m_handle, nullptr) != 0)
        throw thread_resource_error();
}

mutex::~mutex()
{
    pthread_mutex_destroy(&m_handle);
}

void mutex::do_lock()
{
    if (pthread_mutex_lock(&m_handle) != 0)
        throw lock_error();
}

void mutex::do_unlock()
{
    if (pthread_mutex_unlock(&m_handle) != 0)
        throw lock_error();
}

scoped_lock::scoped_lock(mutex& m, bool initially_locked) : m_mutex(m), m_locked(false)
{
    if (initially_locked)
        lock();
}

scoped_lock::~scoped_lock()
{
    // An unlock failure cannot be reported from a destructor; the mutex is
    // then in an undefined state anyway, so the error is dropped here.
    if (m_locked) {
        try {
            unlock();
        } catch (const lock_error&) {
        }
    }
}

void scoped_lock::lock()
{
    if (m_locked)
        throw lock_error();
    m_mutex.do_lock();
    m_locked = true;
}

void scoped_lock::unlock()
{
    if (!m_locked)
        throw lock_error();
    m_mutex.do_unlock();
    m_locked = false;
}

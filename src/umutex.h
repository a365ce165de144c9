// A non-recursive mutex over the operating system's thread mutex, a lock
// bound to one scope, and the two exceptions they throw. These exceptions
// are the only ones the collector defines.
#ifndef WQ5_UMUTEX_H
#define WQ5_UMUTEX_H

#include <pthread.h>
#include <stdexcept>

#include "ubase.h"

// A lock or unlock failed, or a scoped_lock was locked twice or unlocked
// while not holding its mutex. what(): "thread lock error".
class lock_error : public std::runtime_error {
public:
    lock_error();
    ~lock_error() override;
};

// A mutex could not be created. what(): "thread resource error".
class thread_resource_error : public std::runtime_error {
public:
    thread_resource_error();
    ~thread_resource_error() override;
};

class mutex : private noncopyable {
public:
    // Throws thread_resource_error when the mutex cannot be created.
    mutex();
    ~mutex();

private:
    friend class scoped_lock;
    void do_lock();    // throws lock_error
    void do_unlock();  // throws lock_error

    pthread_mutex_t m_handle;
};

// Holds `m` from construction (when initially_locked) until destruction or
// an explicit unlock(); released on every exit from the scope.
class scoped_lock : private noncopyable {
public:
    scoped_lock(mutex& m, bool initially_locked);
    ~scoped_lock();

    void lock();    // lock_error if already held by this object
    void unlock();  // lock_error if not held by this object

private:
    mutex& m_mutex;
    bool m_locked;
};

#endif

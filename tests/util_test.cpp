// Ownership and locking utilities: the edge cases that can really fail.
#include <gtest/gtest.h>

#include <cerrno>
#include <string>
#include <thread>
#include <type_traits>

#include "ucountedptr.h"
#include "umutex.h"

namespace {

struct Tracked {
    explicit Tracked(int* deletions) : deletions(deletions) {}
    ~Tracked() { ++*deletions; }
    int* deletions;
};

TEST(CountedPtrTest, CountsCopiesAndDeletesWithTheLast)
{
    int a = 0, b = 0;
    {
        counted_ptr<Tracked> p(new Tracked(&a));
        counted_ptr<Tracked>& self = p;
        p = self;  // self-assignment changes nothing
        EXPECT_EQ(p.use_count(), 1);
        {
            counted_ptr<Tracked> copy(p);
            EXPECT_EQ(p.use_count(), 2);
        }
        EXPECT_EQ(a, 0);
        EXPECT_EQ(p.use_count(), 1);

        counted_ptr<Tracked> q(new Tracked(&b));
        q = p;  // q's own object goes, p's is shared
        EXPECT_EQ(b, 1);
        EXPECT_EQ(p.use_count(), 2);

        counted_ptr<Tracked> null(nullptr);  // owns only its counter
        EXPECT_EQ(null.use_count(), 1);
    }
    EXPECT_EQ(a, 1);
    EXPECT_EQ(b, 1);
}

// Whether `m` is held, asked from another thread.
bool heldElsewhere(mutex& m)
{
    static_assert(std::is_standard_layout<mutex>::value, "the handle is the mutex's first member");
    pthread_mutex_t* handle = reinterpret_cast<pthread_mutex_t*>(&m);
    int rc = 0;
    std::thread probe([&] {
        rc = pthread_mutex_trylock(handle);
        if (rc == 0)
            pthread_mutex_unlock(handle);
    });
    probe.join();
    return rc == EBUSY;
}

TEST(ScopedLockTest, MisuseThrowsLockError)
{
    mutex m;
    scoped_lock lock(m, true);
    EXPECT_THROW(lock.lock(), lock_error);
    lock.unlock();
    try {
        lock.unlock();
        FAIL() << "unlock while not holding did not throw";
    } catch (const lock_error& e) {
        EXPECT_EQ(std::string(e.what()), "thread lock error");
    }
    EXPECT_EQ(std::string(thread_resource_error().what()), "thread resource error");
}

TEST(ScopedLockTest, ReleasedOnceOnEveryExit)
{
    mutex m;
    scoped_lock* first = new scoped_lock(m, true);
    first->unlock();
    EXPECT_FALSE(heldElsewhere(m));
    scoped_lock second(m, true);
    delete first;  // a second unlock here would release `second`'s hold
    EXPECT_TRUE(heldElsewhere(m));
    second.unlock();

    try {
        scoped_lock held(m, true);
        throw std::runtime_error("leave the scope");
    } catch (const std::runtime_error&) {
    }
    EXPECT_FALSE(heldElsewhere(m));
}

}  // namespace

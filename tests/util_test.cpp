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

TEST(CountedPtrTest, SelfAssignmentKeepsObjectAndCount)
{
    int deletions = 0;
    {
        counted_ptr<Tracked> p(new Tracked(&deletions));
        counted_ptr<Tracked>& alias = p;
        p = alias;
        EXPECT_EQ(p.use_count(), 1);
        EXPECT_EQ(deletions, 0);
        EXPECT_EQ((*p).deletions, &deletions);
    }
    EXPECT_EQ(deletions, 1);
}

TEST(CountedPtrTest, LastCopyDeletes)
{
    int deletions = 0;
    counted_ptr<Tracked>* first = new counted_ptr<Tracked>(new Tracked(&deletions));
    counted_ptr<Tracked> second(*first);
    EXPECT_EQ(second.use_count(), 2);
    delete first;
    EXPECT_EQ(deletions, 0);
    EXPECT_EQ(second.use_count(), 1);
    {
        counted_ptr<Tracked> moved(nullptr);
        moved = second;  // the null one's counter is released, the object shared
        EXPECT_EQ(moved.use_count(), 2);
    }
    EXPECT_EQ(deletions, 0);
}

TEST(CountedPtrTest, AssignmentReleasesPreviousObject)
{
    int a = 0, b = 0;
    counted_ptr<Tracked> p(new Tracked(&a));
    counted_ptr<Tracked> q(new Tracked(&b));
    p = q;
    EXPECT_EQ(a, 1);
    EXPECT_EQ(b, 0);
    EXPECT_EQ(q.use_count(), 2);
}

TEST(CountedPtrTest, NullPointerOwnsOnlyItsCounter)
{
    counted_ptr<Tracked> p(nullptr);
    EXPECT_EQ(p.use_count(), 1);
    EXPECT_EQ(p.get(), nullptr);
    // Leaving the scope releases the counter; LeakSanitizer checks it.
}

TEST(ScopedLockTest, MisuseThrowsLockError)
{
    mutex m;
    scoped_lock lock(m, true);
    try {
        lock.lock();
        FAIL() << "second lock through the same object did not throw";
    } catch (const lock_error& e) {
        EXPECT_EQ(std::string(e.what()), "thread lock error");
    }
    lock.unlock();
    try {
        lock.unlock();
        FAIL() << "unlock while not holding did not throw";
    } catch (const lock_error& e) {
        EXPECT_EQ(std::string(e.what()), "thread lock error");
    }
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

TEST(ScopedLockTest, EarlyUnlockIsNotRepeatedByDestructor)
{
    mutex m;
    scoped_lock* first = new scoped_lock(m, true);
    first->unlock();
    EXPECT_FALSE(heldElsewhere(m));
    scoped_lock second(m, true);
    delete first;  // a second unlock here would release `second`'s hold
    EXPECT_TRUE(heldElsewhere(m));
}

TEST(ScopedLockTest, ReleasedWhenScopeLeftByException)
{
    mutex m;
    try {
        scoped_lock lock(m, true);
        throw std::runtime_error("leave");
    } catch (const std::runtime_error&) {
    }
    scoped_lock again(m, true);  // would deadlock if the first were still held
    SUCCEED();
}

TEST(ExceptionTest, Texts)
{
    EXPECT_EQ(std::string(lock_error().what()), "thread lock error");
    EXPECT_EQ(std::string(thread_resource_error().what()), "thread resource error");
}

}  // namespace

// A reference-counted owning pointer. The count is not atomic: copies of one
// counted_ptr are made and destroyed under the lock that guards the
// container holding them, or by a single thread.
#ifndef WQ5_UCOUNTEDPTR_H
#define WQ5_UCOUNTEDPTR_H

template <class X>
class counted_ptr {
public:
    // Takes ownership of `p` (which may be null) with a new count of 1.
    explicit counted_ptr(X* p) : m_ptr(p), m_pcount(new long(1)) {}

    counted_ptr(const counted_ptr& r) : m_ptr(r.m_ptr), m_pcount(r.m_pcount) { ++*m_pcount; }

    counted_ptr& operator=(const counted_ptr& r)
    {
        if (this != &r) {
            dispose();
            m_ptr = r.m_ptr;
            m_pcount = r.m_pcount;
            ++*m_pcount;
        }
        return *this;
    }

    ~counted_ptr() { dispose(); }

    X& operator*() const { return *m_ptr; }
    X* get() const { return m_ptr; }
    long use_count() const { return *m_pcount; }

private:
// GCC 12 warns when two copies sharing one counter are destroyed in a row
// in inlined code: it cannot see that the first decrement leaves the count
// above 0. The sanitizer tests cover the real case.
#if defined(__GNUC__) && !defined(__clang__) && __GNUC__ >= 12
#pragma GCC diagnostic push
#pragma GCC diagnostic ignored "-Wuse-after-free"
#endif
    void dispose()
    {
        if (--*m_pcount == 0) {
            delete m_pcount;
            delete m_ptr;
        }
    }
#if defined(__GNUC__) && !defined(__clang__) && __GNUC__ >= 12
#pragma GCC diagnostic pop
#endif

    X* m_ptr;
    long* m_pcount;
};

#endif

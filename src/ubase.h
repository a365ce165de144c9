// Base class for objects that must not be copied.
#ifndef WQ5_UBASE_H
#define WQ5_UBASE_H

class noncopyable {
protected:
    noncopyable() {}
    ~noncopyable() {}

private:
    noncopyable(const noncopyable&) = delete;
    noncopyable& operator=(const noncopyable&) = delete;
};

#endif

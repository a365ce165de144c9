// One traffic selection given to the collection library: a protocol and
// service number and the callback that receives its tables. Created once by
// the FilterManager and shared through counted_ptr; never copied.
#ifndef WQ5_MFILTER_H
#define WQ5_MFILTER_H

#include <cstdint>

class Filter {
public:
    Filter(unsigned short proto, unsigned short serv, void (*callback)(void*));
    ~Filter();

    Filter(const Filter&) = delete;
    Filter& operator=(const Filter&) = delete;

    uint32_t m_filterId;  // 0; the id the library may assign is not read back
    uint16_t m_proto;
    uint16_t m_serv;
    void (*m_callback)(void*);
};

#endif

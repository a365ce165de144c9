#include "mfilter.h"

Filter::Filter(unsigned short proto, unsigned short serv, void (*callback)(void*))
    : m_filterId(0), m_proto(proto), m_serv(serv), m_callback(callback)
{
}

Filter::~Filter() {}

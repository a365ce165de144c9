// The C entry points of libzub1api.so: the collection calls of
// zub/zub1api.h and the control calls of libzub1api/zub1sim.h. Each one
// hands over to the simulator; no C++ exception leaves the library.
#include <exception>

#include "libzub1api/simulator.h"
#include "libzub1api/zub1sim.h"
#include "zub/zub1api.h"

#define ZUB1_EXPORT extern "C" __attribute__((visibility("default")))

namespace {

template <typename Call>
int guarded(const char* name, int failure, Call call)
{
    try {
        return call();
    } catch (const std::exception& e) {
        zub1sim::report("%s: %s", name, e.what());
    } catch (...) {
        zub1sim::report("%s: unexpected exception", name);
    }
    return failure;
}

}  // namespace

ZUB1_EXPORT int ZUB1_RegisterApplication(ZUB_APPL_ID* id, const char* name, int, int)
{
    return guarded("ZUB1_RegisterApplication", ZUB1SIM_RC_INTERNAL,
                   [&] { return zub1sim::simulator().registerApplication(id, name); });
}

ZUB1_EXPORT int ZUB1_DefineFilter(ZUB_APPL_ID* id, ZUB_FILTER_REQUEST* request)
{
    return guarded("ZUB1_DefineFilter", ZUB1SIM_RC_INTERNAL,
                   [&] { return zub1sim::simulator().defineFilter(id, request); });
}

ZUB1_EXPORT int ZUB1_FreeResponseTimeResult(void* table)
{
    return guarded("ZUB1_FreeResponseTimeResult", ZUB1SIM_RC_INTERNAL,
                   [&] { return zub1sim::simulator().freeResult(table); });
}

ZUB1_EXPORT int ZUB1_UnregisterApplication(ZUB_APPL_ID* id)
{
    return guarded("ZUB1_UnregisterApplication", ZUB1SIM_RC_INTERNAL,
                   [&] { return zub1sim::simulator().unregisterApplication(id); });
}

ZUB1_EXPORT int ZUB1SIM_Reset(void)
{
    return guarded("ZUB1SIM_Reset", -1, [] { return zub1sim::simulator().reset(); });
}

ZUB1_EXPORT void ZUB1SIM_GetStats(ZUB1SIM_STATS* stats)
{
    guarded("ZUB1SIM_GetStats", 0, [&] {
        zub1sim::simulator().getStats(stats);
        return 0;
    });
}

ZUB1_EXPORT int ZUB1SIM_WaitIdle(int timeoutMs)
{
    return guarded("ZUB1SIM_WaitIdle", -1, [&] { return zub1sim::simulator().waitIdle(timeoutMs); });
}

ZUB1_EXPORT int ZUB1SIM_DeliverLine(const char* jsonLine)
{
    return guarded("ZUB1SIM_DeliverLine", -1,
                   [&] { return zub1sim::simulator().deliverLine(jsonLine); });
}

ZUB1_EXPORT int ZUB1SIM_GetFilters(ZUB1SIM_FILTER* filters, int capacity)
{
    return guarded("ZUB1SIM_GetFilters", 0,
                   [&] { return zub1sim::simulator().getFilters(filters, capacity); });
}

ZUB1_EXPORT void ZUB1SIM_HoldDelivery(int hold)
{
    guarded("ZUB1SIM_HoldDelivery", 0, [&] {
        zub1sim::simulator().holdDelivery(hold != 0);
        return 0;
    });
}

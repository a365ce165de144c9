// The promise of every table the simulator builds from a script line or a
// HAR capture: the entries follow the header, the entry count is no larger
// than the entries present, and every text reference shared by both views
// points behind the entries at a text terminated before the area ends.
#ifndef WQ5_FUZZ_SCRIPT_AREA_H
#define WQ5_FUZZ_SCRIPT_AREA_H

#include <cstdint>
#include <cstdlib>
#include <cstring>

#include "libzub1api/tablescript.h"
#include "zub/zub1rt.h"

inline void fuzzCheck(bool ok)
{
    if (!ok)
        abort();
}

inline void checkArea(const zub1sim::ScriptTable& table)
{
    const size_t header = sizeof(ZUB_RESPONSE_TIME_DATA_TABLE);
    const uintptr_t base = reinterpret_cast<uintptr_t>(table.area.get());
    fuzzCheck(base != 0 && table.size >= header);
    const auto* head = static_cast<const ZUB_RESPONSE_TIME_DATA_TABLE*>(table.area.get());
    const ZUB_RESPONSE_TIME_DATA* first = zubEntry(head, 0);
    if (first == nullptr)
        return;
    fuzzCheck(reinterpret_cast<uintptr_t>(first) == base + header);
    const size_t entries = (table.size - header) / ZUB_ENTRY_SIZE;
    fuzzCheck(entries > 0 && head->entryCount <= static_cast<int32_t>(entries));
    const uintptr_t textBegin = base + header + entries * ZUB_ENTRY_SIZE;
    for (const ZUB_RESPONSE_TIME_DATA* e = first; e < first + entries; ++e) {
        const ResponseTimeDetail& d = e->detail;
        for (ZUB_REF ref : {d.url, d.detailText1, d.detailText2, d.detailText3}) {
            const uintptr_t text = reinterpret_cast<uintptr_t>(zubText(e, ref));
            if (text == 0)
                continue;
            fuzzCheck(text >= textBegin && text < base + table.size);
            fuzzCheck(memchr(reinterpret_cast<const void*>(text), '\0', base + table.size - text) != nullptr);
        }
    }
}

#endif

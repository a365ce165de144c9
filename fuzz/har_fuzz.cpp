// HAR captures of any bytes: recognised or not, converted or rejected with
// a reason; a converted capture gives one table entry per entry that was
// not skipped, and every table builds into an area that keeps the promise
// of script_area.h.
#include <cstdint>
#include <string>

#include "libzub1api/har.h"
#include "script_area.h"

extern "C" int LLVMFuzzerTestOneInput(const uint8_t* data, size_t size)
{
    const std::string content(reinterpret_cast<const char*>(data), size);
    (void)zub1sim::looksLikeHar(content);
    zub1sim::HarReplay replay;
    std::string error;
    if (!zub1sim::convertHar(content, replay, error)) {
        fuzzCheck(!error.empty() && replay.tables.empty());
        return 0;
    }
    fuzzCheck(replay.skipped <= replay.entries);
    uint64_t built = 0;
    for (const nlohmann::json& doc : replay.tables) {
        zub1sim::ScriptTable table;
        fuzzCheck(zub1sim::buildTable(doc, table, error));
        checkArea(table);
        ZUB_RESPONSE_TIME_DATA_TABLE head;
        memcpy(&head, table.area.get(), sizeof head);
        built += head.entryCount > 0 ? static_cast<uint64_t>(head.entryCount) : 0;
    }
    fuzzCheck(built == replay.entries - replay.skipped);
    return 0;
}

// Table scripts of any bytes, read as the simulator reads them: line by
// line, skipped lines left out. A line is either rejected with a reason or
// gives an area that keeps the promise of script_area.h.
#include <cstdint>
#include <string>

#include "script_area.h"

extern "C" int LLVMFuzzerTestOneInput(const uint8_t* data, size_t size)
{
    const std::string script(reinterpret_cast<const char*>(data), size);
    size_t start = 0;
    while (start <= script.size()) {
        size_t end = script.find('\n', start);
        if (end == std::string::npos)
            end = script.size();
        const std::string line = script.substr(start, end - start);
        start = end + 1;
        if (zub1sim::isSkippedLine(line))
            continue;
        zub1sim::ScriptTable table;
        std::string error;
        if (zub1sim::parseTableLine(line, table, error))
            checkArea(table);
        else
            fuzzCheck(!error.empty());
    }
    return 0;
}

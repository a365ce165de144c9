// One line of a table script turned into a finished result area.
#ifndef WQ5_LIBZUB1API_TABLESCRIPT_H
#define WQ5_LIBZUB1API_TABLESCRIPT_H

#include <cstdint>
#include <cstdlib>
#include <memory>
#include <string>

#include <nlohmann/json_fwd.hpp>

namespace zub1sim {

struct AreaFree {
    void operator()(void* area) const { std::free(area); }
};
using AreaPtr = std::unique_ptr<void, AreaFree>;

// A table ready for delivery: one malloc'ed block holding the table header,
// the entries and then every text the entries refer to, so that a read past
// any of them leaves the block.
struct ScriptTable {
    uint16_t protocol = 0;
    uint16_t service = 0;
    AreaPtr area;
    size_t size = 0;
};

// Parses `line` (one JSON object: "filter", "entries", optional
// "entryCount") and builds its table. On success returns true and fills
// `table`; otherwise returns false with `error` saying what is wrong, in
// words fit to follow "file:line: ".
bool parseTableLine(const std::string& line, ScriptTable& table, std::string& error);

// The same for a table already in JSON form (what one script line holds):
// HAR captures are turned into such objects and built by the same rules.
bool buildTable(const nlohmann::json& doc, ScriptTable& table, std::string& error);

// True for the lines a script skips: empty, only blanks, or a comment whose
// first non-blank character is '#'.
bool isSkippedLine(const std::string& line);

}  // namespace zub1sim

#endif

// HAR captures (HTTP Archive 1.1 and 1.2, as browsers' developer tools and
// proxies save them) turned into tables, in the JSON form that one line of a
// table script holds, so that they are built and delivered exactly like
// script tables. libzub1api/README.md gives the mapping of every field.
#ifndef WQ5_LIBZUB1API_HAR_H
#define WQ5_LIBZUB1API_HAR_H

#include <cstdint>
#include <string>
#include <vector>

#include <nlohmann/json.hpp>

namespace zub1sim {

// True when `start`, the first bytes of a file, opens a HAR capture: after
// an optional UTF-8 byte-order mark and blanks, a JSON object whose first
// key is "log". A table script never starts so (its objects have "filter",
// "entries" and "entryCount" only), which is how a replay file is told apart
// by its content.
bool looksLikeHar(const std::string& start);

// One capture, ready to replay.
struct HarReplay {
    std::vector<nlohmann::json> tables;  // in replay order
    uint64_t entries = 0;                // entries of the capture
    uint64_t skipped = 0;                // of those, the ones that yield no record
    std::vector<std::string> problems;   // why unusable entries were skipped, one text each
};

// Turns the capture `content` (the whole file) into tables. Every entry of
// a network scheme (http, https, ws, wss) becomes exactly one table entry;
// the others (data:, blob:, about: ...) and entries that are no request at
// all are skipped and counted. Returns false, with `error` saying why in one
// line, when `content` is no HAR capture (not JSON, or no "log" object with
// an "entries" array); `replay` is then left empty.
bool convertHar(const std::string& content, HarReplay& replay, std::string& error);

}  // namespace zub1sim

#endif

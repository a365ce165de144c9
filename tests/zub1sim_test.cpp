// The simulated collection library seen from an application: the tables it
// builds from script lines, the lines it rejects, filter matching,
// registration, concurrent delivery, unregistration and the status file.
#include <gtest/gtest.h>

#include <algorithm>
#include <chrono>
#include <condition_variable>
#include <cstring>
#include <map>
#include <mutex>
#include <optional>
#include <string>
#include <tuple>
#include <vector>

#include "libzub1api/zub1sim.h"
#include "support/process.h"
#include "support/stderr_capture.h"
#include "zub/zub1api.h"
#include "zub/zub1rt.h"

namespace {

using namespace wq5test;
constexpr int GUARD_MS = 60000;  // only against hangs; no test judges speed
using Text = std::optional<std::string>;

// What a callback saw of one table, copied before the table goes back.
struct Seen {
    int callback = 0;
    int32_t entryCount = 0;
    long entriesOffset = -1;                    // first entry's distance from the table; -1: null
    std::vector<std::string> entries;           // the 616 bytes of each
    std::vector<std::map<size_t, Text>> texts;  // by offset of the reference
    template <typename T>
    T at(size_t entry, size_t offset) const
    {
        T value;
        std::memcpy(&value, entries.at(entry).data() + offset, sizeof value);
        return value;
    }
};

Seen inspect(void* area, int callback)
{
    const auto* table = static_cast<const ZUB_RESPONSE_TIME_DATA_TABLE*>(area);
    Seen seen;
    seen.callback = callback;
    seen.entryCount = table->entryCount;
    if (zubEntry(table, 0) == nullptr) return seen;
    seen.entriesOffset = reinterpret_cast<const char*>(zubEntry(table, 0)) - static_cast<const char*>(area);
    for (int i = 0; i < table->entryCount; ++i) {
        const ZUB_RESPONSE_TIME_DATA* entry = zubEntry(table, i);
        seen.entries.emplace_back(reinterpret_cast<const char*>(entry), ZUB_ENTRY_SIZE);
        seen.texts.emplace_back();
        const bool http = std::memcmp(entry->rdType, "HTTP", 4) == 0;
        for (size_t offset : {192, 196, 200, 204, 212}) {  // url, detailText1..3, title
            if (offset == 212 && !http) continue;
            const char* text = zubText(entry, seen.at<ZUB_REF>(static_cast<size_t>(i), offset));
            seen.texts.back()[offset] = text == nullptr ? Text() : Text(text);
        }
    }
    return seen;
}

// State shared with the callbacks, which are plain functions as the
// collector's are.
struct Recorder {
    std::mutex mutex;
    std::condition_variable cv;
    std::vector<Seen> seen;
    ZUB_APPL_ID appl = 0;
    int arrived = 0;
    std::vector<int> unregisterRcs;
    template <typename Pred>
    bool waitFor(Pred pred)
    {
        std::unique_lock<std::mutex> lock(mutex);
        return cv.wait_for(lock, std::chrono::milliseconds(GUARD_MS), pred);
    }
    template <typename Change>
    void update(Change change)
    {
        std::lock_guard<std::mutex> lock(mutex);
        change();
        cv.notify_all();
    }
};
Recorder* g_rec = nullptr;

void endApplicationFromCallback()
{
    ZUB_APPL_ID copy = 0;
    g_rec->update([&] { copy = g_rec->appl; });
    const int rc = ZUB1_UnregisterApplication(&copy);
    g_rec->update([&] { g_rec->unregisterRcs.push_back(rc); });
}

// Records before giving back, so that ZUB1SIM_WaitIdle implies the record.
template <int N>
void capture(void* table)
{
    Seen seen = inspect(table, N);
    g_rec->update([&] { g_rec->seen.push_back(seen); });
    ZUB1_FreeResponseTimeResult(table);
}

// Two callbacks meet (so both run at once), then both unregister.
void meetThenUnregister(void* table)
{
    g_rec->update([] { ++g_rec->arrived; });
    EXPECT_TRUE(g_rec->waitFor([] { return g_rec->arrived >= 2; }));
    ZUB1_FreeResponseTimeResult(table);
    endApplicationFromCallback();
}

std::string table(const char* filter, int intValue)
{
    return std::string(R"({"filter":)") + filter + R"(,"entries":[{"rdType":"HTTP","intValue":)" +
           std::to_string(intValue) + "}]}";
}

void deliver(const std::vector<std::string>& lines)
{
    for (const std::string& line : lines) ASSERT_EQ(ZUB1SIM_DeliverLine(line.c_str()), 0) << line;
}

class Zub1SimTest : public ::testing::Test {
protected:
    void SetUp() override
    {
        ASSERT_EQ(ZUB1SIM_Reset(), 0);
        for (const char* name : {"ZUB1_REPLAY", "ZUB1_THREADS", "ZUB1_STATUS_FILE", "ZUB1_REGISTER_FAILURES",
                                 "ZUB1_LOOPS", "ZUB1_RATE"})
            unsetenv(name);
        setenv("ZUB1_START_DELAY_MS", "0", 1);
        g_rec = new Recorder;
        ASSERT_FALSE((m_dir = makeTempDir()).empty());
    }
    void TearDown() override
    {
        ZUB_APPL_ID appl = 0;
        g_rec->update([&] { appl = g_rec->appl; });
        if (appl != 0) ZUB1_UnregisterApplication(&appl);
        EXPECT_EQ(ZUB1SIM_Reset(), 0);  // joins the threads: no callback uses g_rec any more
        delete g_rec;
        removeTree(m_dir);
    }
    // Registers and defines the filters (protocol, service, callback)
    // before any table can arrive.
    void registerWith(const std::vector<std::tuple<uint16_t, uint16_t, ZUB_CALLBACK>>& filters)
    {
        ZUB1SIM_HoldDelivery(1);
        ZUB_APPL_ID appl = 0;
        EXPECT_EQ(ZUB1_RegisterApplication(&appl, "test", 0, 0), 0);
        for (const auto& [protocol, service, callback] : filters) {
            ZUB_FILTER_REQUEST request{};
            request.requestType = ZUB_REQ_DEFINE_FILTER;
            request.level = ZUB_REQ_LEVEL;
            request.flags = ZUB_REQ_FLAG_CALLBACK;
            request.protocol = protocol;
            request.service = service;
            request.callback = callback;
            EXPECT_EQ(ZUB1_DefineFilter(&appl, &request), 0);
        }
        g_rec->update([&] { g_rec->appl = appl; });
        ZUB1SIM_HoldDelivery(0);
    }
    static ZUB1SIM_STATS stats()
    {
        ZUB1SIM_STATS stats;
        ZUB1SIM_GetStats(&stats);
        return stats;
    }
    std::string m_dir;
};

// The layout, field by field. Kinds: 'u' u32, 'i' i32, 's' u16, 't' inline
// text of `width` bytes, 'p' text reference. Media fields go to entry 1.
const struct FieldRow {
    const char* name;
    size_t offset;
    char kind;
    size_t width = 0;
} FIELD_ROWS[] = {
    {"registeredFlag", 12, 'u'}, {"stampText", 16, 't', 32}, {"intValue", 48, 'i'}, {"ulongValue", 52, 'u'},
    {"textA", 56, 't', 40}, {"ushortA", 96, 's'}, {"ushortB", 98, 's'}, {"textB", 100, 't', 16},
    {"textC", 116, 't', 24}, {"intMetric1", 140, 'i'}, {"intMetric2", 144, 'i'}, {"intMetric3", 148, 'i'},
    {"intMetric4", 152, 'i'}, {"intMetric5", 156, 'i'}, {"longMetric1", 160, 'i'}, {"longMetric2", 164, 'i'},
    {"longMetric3", 168, 'i'}, {"url", 192, 'p'}, {"detailText1", 196, 'p'}, {"detailText2", 200, 'p'},
    {"detailText3", 204, 'p'}, {"title", 212, 'p'}, {"httpText", 216, 't', 32}, {"httpInt0", 248, 'i'},
    {"httpInt1", 252, 'i'}, {"httpInt2", 280, 'i'}, {"httpInt3", 284, 'i'}, {"httpInt4", 288, 'i'},
    {"httpInt5", 292, 'i'}, {"httpInt6", 296, 'i'}, {"httpInt7", 300, 'i'}, {"httpEntryType", 304, 'i'},
    {"httpInt8", 308, 'i'}, {"httpInt9", 312, 'i'}, {"httpInt10", 316, 'i'}, {"httpInt11", 320, 'i'},
    {"httpInt12", 324, 'i'}, {"mediaText", 208, 't', 32}, {"mediaInt0", 240, 'i'}, {"mediaInt1", 260, 'i'},
    {"mediaInt2", 264, 'i'},
};

// Each field gets a value of its own (1000 + row, or "v<row>") and must
// show it at its offset; a third entry holds the edge cases.
TEST_F(Zub1SimTest, EveryFieldLandsAtItsOffset)
{
    std::string fields[2] = {R"("rdType":"HTTP")", R"("rdType":"MSVD")"};
    const auto entryOf = [](const FieldRow& row) { return std::strncmp(row.name, "media", 5) == 0 ? 1 : 0; };
    for (size_t i = 0; i < std::size(FIELD_ROWS); ++i) {
        const bool text = std::strchr("tp", FIELD_ROWS[i].kind) != nullptr;
        fields[entryOf(FIELD_ROWS[i])] += ",\"" + std::string(FIELD_ROWS[i].name) +
                                          "\":" + (text ? "\"v" + std::to_string(i) + "\"" : std::to_string(1000 + i));
    }
    // A text filling its field has no terminator, a short rdType is
    // NUL-padded, null and "" references differ, registeredFlag defaults to 1.
    const std::string edges = R"({"rdType":"TCP","textB":"ABCDEFGHIJKLMNOP","textC":"s","url":null,"detailText2":""})";
    const std::string line = R"({"filter":[0,80],"entries":[{)" + fields[0] + "},{" + fields[1] + "}," + edges + "]}";
    registerWith({{0, 80, capture<1>}});
    deliver({line});
    ASSERT_EQ(ZUB1SIM_WaitIdle(GUARD_MS), 0);
    ASSERT_EQ(g_rec->seen.size(), 1u);
    const Seen& seen = g_rec->seen[0];
    EXPECT_EQ(seen.entriesOffset, 24);  // right behind the 24-byte header
    ASSERT_EQ(seen.entries.size(), 3u);
    for (size_t i = 0; i < std::size(FIELD_ROWS); ++i) {
        const FieldRow& row = FIELD_ROWS[i];
        const size_t entry = entryOf(row);
        SCOPED_TRACE(row.name);
        if (row.kind == 't') {
            std::string expected = "v" + std::to_string(i);
            expected.resize(row.width, '\0');
            EXPECT_EQ(seen.entries[entry].substr(row.offset, row.width), expected);
        } else if (row.kind == 'p') {
            EXPECT_EQ(seen.texts[entry].at(row.offset), Text("v" + std::to_string(i)));
        } else {
            const long long value = row.kind == 'u'   ? seen.at<uint32_t>(entry, row.offset)
                                    : row.kind == 'i' ? seen.at<int32_t>(entry, row.offset)
                                                      : seen.at<uint16_t>(entry, row.offset);
            EXPECT_EQ(value, static_cast<long long>(1000 + i));
        }
    }
    EXPECT_EQ(seen.entries[2].substr(188, 4), std::string("TCP\0", 4));
    EXPECT_EQ(seen.entries[2].substr(100, 17), "ABCDEFGHIJKLMNOPs");  // runs into textC
    EXPECT_EQ(seen.at<uint32_t>(2, 12), 1u);
    EXPECT_EQ(seen.texts[2], (std::map<size_t, Text>{{192, {}}, {196, {}}, {200, ""}, {204, {}}}));
}

TEST_F(Zub1SimTest, EntryCountAndEmptyTables)
{
    const struct {
        const char* line;
        int32_t entryCount;
        long entriesOffset;  // -1: null entry pointer
    } rows[] = {
        {R"({"filter":[0,80],"entries":[{},{},{}]})", 3, 24},
        {R"({"filter":[0,80],"entries":[{},{}],"entryCount":1})", 1, 24},
        {R"({"filter":[0,80],"entries":[{}],"entryCount":-3})", -3, 24},
        {R"({"filter":[0,80],"entries":[]})", 0, -1},
        {R"({"filter":[0,80]})", 0, -1},
        {R"({"filter":[0,80],"entries":[],"entryCount":-1})", -1, -1},
    };
    setenv("ZUB1_THREADS", "1", 1);  // one thread: callbacks in queue order
    registerWith({{0, 80, capture<1>}});
    for (const auto& row : rows) deliver({row.line});
    ASSERT_EQ(ZUB1SIM_WaitIdle(GUARD_MS), 0);
    ASSERT_EQ(g_rec->seen.size(), std::size(rows));
    for (size_t i = 0; i < std::size(rows); ++i) {
        EXPECT_EQ(g_rec->seen[i].entryCount, rows[i].entryCount) << rows[i].line;
        EXPECT_EQ(g_rec->seen[i].entriesOffset, rows[i].entriesOffset) << rows[i].line;
    }
}

const struct InvalidRow {
    const char* line;
    const char* message;  // expected after "<where>: "
} INVALID_ROWS[] = {
    {R"({"filter":[0,80],"entries":[{"foo":1}]})", R"(unknown field "foo" in entry 0)"},
    {R"({"filter":[0,80],"entries":[{"textB":"ABCDEFGHIJKLMNOPQ"}]})", R"(text too long for "textB")"},
    {R"({"filter":[0,80],"entries":[{},{"title":"t","mediaInt0":1}]})",
     R"(HTTP field "title" and media field "mediaInt0" both in entry 1)"},
    {R"({"filter":[0,80],"entries":[{}],"entryCount":2})", "entryCount 2 exceeds the 1 entries given"},
    {R"({"filter":[0,80],)", "invalid JSON"},
    {R"({"filter":[0,80],"entries":[{"ushortA":65536}]})", R"("ushortA" out of range)"},
    {R"({"filter":[0,80],"entries":[{"registeredFlag":-1}]})", R"("registeredFlag" out of range)"},
    {R"({"filter":[0,80],"entries":[{"intValue":1.5}]})", R"("intValue" must be an integer)"},
    {R"({"filter":[0,80],"entries":[{"url":7}]})", R"("url" must be a string or null)"},
    {R"({"entries":[]})", R"(missing "filter")"},
};

// A script with comments, invalid lines and a table no filter takes; the
// status file is written once everything is given back, and again after.
TEST_F(Zub1SimTest, InvalidLinesAndUnmatchedTablesAreCountedInTheStatus)
{
    const std::string script = m_dir + "/script.jsonl", status = m_dir + "/status.json";
    std::string text = table("[0,80]", 1) + "\n# a comment\n\n";  // lines 1 to 3
    for (const InvalidRow& row : INVALID_ROWS) text += std::string(row.line) + "\n";
    writeFile(script, text + "  # an indented comment\n" + table("[5,0]", 2) + "\n" + table("[0,80]", 3) + "\n");
    setenv("ZUB1_REPLAY", script.c_str(), 1);
    setenv("ZUB1_STATUS_FILE", status.c_str(), 1);
    setenv("ZUB1_THREADS", "1", 1);
    StderrCapture err(m_dir + "/stderr.txt");
    registerWith({{0, 80, capture<1>}});
    ASSERT_EQ(ZUB1SIM_WaitIdle(GUARD_MS), 0);
    const std::string counts = R"("badFrees":0,"defineRequests":1,"delivered":2,"entries":0,"filtersDefined":1,)"
                               R"("freed":2,"invalid":)" + std::to_string(std::size(INVALID_ROWS)) +
                               R"(,"refusals":0,"registrations":1,"skipped":0,"tables":3,"unmatched":1,)";
    EXPECT_EQ(readFile(status), "{" + counts + "\"unregistrations\":0}\n");
    for (const InvalidRow& row : INVALID_ROWS) EXPECT_EQ(ZUB1SIM_DeliverLine(row.line), -1) << row.line;
    ASSERT_EQ(ZUB1SIM_WaitIdle(GUARD_MS), 0);
    EXPECT_NE(readFile(status).find("\"invalid\":" + std::to_string(2 * std::size(INVALID_ROWS))), std::string::npos);
    const std::string errors = err.text();
    for (size_t i = 0; i < std::size(INVALID_ROWS); ++i) {
        for (const std::string& where :
             {script + ":" + std::to_string(i + 4), "ZUB1SIM_DeliverLine:" + std::to_string(i + 1)}) {
            const std::string expected = "zub1api: " + where + ": " + INVALID_ROWS[i].message;
            EXPECT_NE(errors.find(expected), std::string::npos) << expected << "\nin:\n" << errors;
        }
    }
    ASSERT_EQ(g_rec->seen.size(), 2u);
    EXPECT_EQ(g_rec->seen[0].at<int32_t>(0, 48), 1);
    EXPECT_EQ(g_rec->seen[1].at<int32_t>(0, 48), 3);
}

TEST_F(Zub1SimTest, RefusedRegistrationsLeaveTheIdAlone)
{
    setenv("ZUB1_REGISTER_FAILURES", "2", 1);
    StderrCapture err(m_dir + "/stderr.txt");
    for (int attempt = 1; attempt <= 2; ++attempt) {
        ZUB_APPL_ID appl = 0;
        EXPECT_EQ(ZUB1_RegisterApplication(&appl, "test", 0, 0), ZUB1SIM_RC_REFUSED) << "attempt " << attempt;
        EXPECT_EQ(appl, 0u) << "attempt " << attempt;
    }
    registerWith({});
    EXPECT_EQ(stats().refusals, 2u);
    EXPECT_EQ(stats().registrations, 1u);
}

TEST_F(Zub1SimTest, EveryTableIsFreedOnceUnderConcurrentDelivery)
{
    setenv("ZUB1_THREADS", "4", 1);
    registerWith({{0, 80, capture<1>}, {1, 0, capture<2>}});
    for (int i = 0; i < 200; ++i) deliver({table(i % 2 ? "[1,0]" : "[0,80]", i)});
    ASSERT_EQ(ZUB1SIM_WaitIdle(GUARD_MS), 0);
    EXPECT_EQ(stats().freed, 200u);
    EXPECT_EQ(stats().badFrees, 0u);
    std::vector<int> times(200, 0);
    for (const Seen& seen : g_rec->seen) {
        EXPECT_EQ(seen.callback, seen.at<int32_t>(0, 48) % 2 ? 2 : 1) << "table went to the wrong filter";
        ++times.at(seen.at<int32_t>(0, 48));
    }
    EXPECT_EQ(std::count(times.begin(), times.end(), 1), 200);
}

// Two callbacks unregister at once from inside: no deadlock, no callback
// after; delivery pauses, and the tables queued meanwhile wait, in order,
// for the next registration.
TEST_F(Zub1SimTest, UnregisteringFromCallbacksPausesDelivery)
{
    setenv("ZUB1_THREADS", "2", 1);
    registerWith({{0, 80, meetThenUnregister}});
    deliver({table("[0,80]", 1), table("[0,80]", 2)});
    ASSERT_TRUE(g_rec->waitFor([] { return g_rec->unregisterRcs.size() == 2; }));
    g_rec->update([] {
        EXPECT_EQ(g_rec->unregisterRcs, (std::vector<int>{0, 0}));
        g_rec->appl = 0;
    });
    EXPECT_EQ(stats().unregistrations, 1u);
    EXPECT_EQ(ZUB1SIM_GetFilters(nullptr, 0), 0);
    deliver({table("[0,80]", 3), table("[0,80]", 4)});
    EXPECT_EQ(ZUB1SIM_WaitIdle(0), -1);
    EXPECT_EQ(stats().delivered, 2u);
    EXPECT_EQ(stats().unmatched, 0u);
    registerWith({{0, 80, capture<1>}});
    ASSERT_EQ(ZUB1SIM_WaitIdle(GUARD_MS), 0);
    EXPECT_EQ(stats().unmatched, 0u);
    ASSERT_EQ(g_rec->seen.size(), 2u);
    std::vector<int32_t> values = {g_rec->seen[0].at<int32_t>(0, 48), g_rec->seen[1].at<int32_t>(0, 48)};
    std::sort(values.begin(), values.end());
    EXPECT_EQ(values, (std::vector<int32_t>{3, 4}));
}

}  // namespace

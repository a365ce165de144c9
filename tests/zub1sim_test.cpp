// The simulated collection library seen from an application: the tables it
// builds, the script lines it rejects, filter matching, registration,
// concurrent delivery and unregistration.
#include <fcntl.h>
#include <sys/wait.h>
#include <unistd.h>

#include <gtest/gtest.h>

#include <algorithm>
#include <chrono>
#include <condition_variable>
#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <filesystem>
#include <fstream>
#include <map>
#include <mutex>
#include <optional>
#include <string>
#include <thread>
#include <vector>

#include "libzub1api/zub1sim.h"
#include "zub/zub1api.h"
#include "zub/zub1rt.h"

namespace {

// Only against hangs of a broken library; no test judges speed.
constexpr auto GUARD = std::chrono::seconds(60);
constexpr int GUARD_MS = 60000;

using Text = std::optional<std::string>;

// What a callback saw of one table, copied before the table goes back.
struct Seen {
    int callback = 0;
    int32_t entryCount = 0;
    long entriesOffset = -1;         // first entry's distance from the table; -1: null
    bool textsBehindEntries = true;  // every text lies after the last entry
    std::vector<std::vector<unsigned char>> entries;
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
    const int count = std::max(table->entryCount, 0);
    const char* entriesEnd = reinterpret_cast<const char*>(zubEntry(table, count));
    for (int i = 0; i < count; ++i) {
        const ZUB_RESPONSE_TIME_DATA* entry = zubEntry(table, i);
        const auto* bytes = reinterpret_cast<const unsigned char*>(entry);
        seen.entries.emplace_back(bytes, bytes + ZUB_ENTRY_SIZE);
        std::vector<size_t> refs = {192, 196, 200, 204};          // url, detailText1..3
        if (std::memcmp(entry->rdType, "HTTP", 4) == 0) refs.push_back(212);  // title
        seen.texts.emplace_back();
        for (size_t offset : refs) {
            ZUB_REF ref;
            std::memcpy(&ref, bytes + offset, sizeof ref);
            const char* text = zubText(entry, ref);
            seen.texts.back()[offset] = text == nullptr ? Text() : Text(text);
            if (text != nullptr && text < entriesEnd) seen.textsBehindEntries = false;
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
    bool release = false;  // lets slowCallback return
    bool finished = false;
    bool finishedAtUnregister = false;
    std::vector<int> unregisterRcs;
    std::vector<bool> metPartner;
    void* kept = nullptr;

    template <typename Pred>
    bool waitFor(Pred pred)
    {
        std::unique_lock<std::mutex> lock(mutex);
        return cv.wait_for(lock, GUARD, pred);
    }
    template <typename Change>
    void update(Change change)
    {
        std::lock_guard<std::mutex> lock(mutex);
        change();
        cv.notify_all();
    }
    void endApplicationFromCallback()
    {
        ZUB_APPL_ID copy = 0;
        update([&] { copy = appl; });
        const int rc = ZUB1_UnregisterApplication(&copy);
        update([&] {
            unregisterRcs.push_back(rc);
            finishedAtUnregister = finished;
        });
    }
};
Recorder* g_rec = nullptr;

// Records before giving back, so that ZUB1SIM_WaitIdle implies the record.
template <int N>
void capture(void* table)
{
    Seen seen = inspect(table, N);
    g_rec->update([&] { g_rec->seen.push_back(seen); });
    ZUB1_FreeResponseTimeResult(table);
}

// Like the collector: a first entry with registeredFlag 0 ends the
// registration from inside the callback.
void dropOnFlagZero(void* table)
{
    Seen seen = inspect(table, 1);
    if (seen.at<uint32_t>(0, 12) == 0) g_rec->endApplicationFromCallback();
    g_rec->update([&] { g_rec->seen.push_back(seen); });
    ZUB1_FreeResponseTimeResult(table);
}

void keepTable(void* table)
{
    g_rec->update([&] { g_rec->kept = table; });
}

// Each of two callbacks waits until the other has started too.
void rendezvous(void* table)
{
    std::unique_lock<std::mutex> lock(g_rec->mutex);
    ++g_rec->arrived;
    g_rec->cv.notify_all();
    g_rec->metPartner.push_back(g_rec->cv.wait_for(lock, GUARD, [] { return g_rec->arrived >= 2; }));
    lock.unlock();
    ZUB1_FreeResponseTimeResult(table);
}

void rendezvousThenUnregister(void* table)
{
    rendezvous(table);
    g_rec->endApplicationFromCallback();
}

// Runs until released, then marks itself finished as its last step.
void slowCallback(void* table)
{
    g_rec->update([] { ++g_rec->arrived; });
    g_rec->waitFor([] { return g_rec->release; });
    ZUB1_FreeResponseTimeResult(table);
    g_rec->update([] { g_rec->finished = true; });
}

// Releases the running slowCallback, then unregisters while it may still run.
void unregisteringCallback(void* table)
{
    g_rec->waitFor([] { return g_rec->arrived >= 1; });
    g_rec->update([] { g_rec->release = true; });
    ZUB1_FreeResponseTimeResult(table);
    g_rec->endApplicationFromCallback();
}

ZUB_FILTER_REQUEST defineRequest(uint16_t protocol, uint16_t service, ZUB_CALLBACK callback)
{
    ZUB_FILTER_REQUEST request;
    std::memset(&request, 0, sizeof request);
    request.requestType = ZUB_REQ_DEFINE_FILTER;
    request.level = ZUB_REQ_LEVEL;
    request.flags = ZUB_REQ_FLAG_CALLBACK;
    request.service = service;
    request.protocol = protocol;
    request.callback = callback;
    return request;
}

std::string readFile(const std::string& path)
{
    std::ifstream in(path);
    return std::string(std::istreambuf_iterator<char>(in), std::istreambuf_iterator<char>());
}

// Sends stderr to a file while it lives.
class StderrCapture {
public:
    explicit StderrCapture(std::string path) : m_path(std::move(path)), m_saved(dup(2))
    {
        std::fflush(stderr);
        const int fd = open(m_path.c_str(), O_WRONLY | O_CREAT | O_TRUNC, 0600);
        dup2(fd, 2);
        close(fd);
    }
    ~StderrCapture() { restore(); }
    std::string text()
    {
        restore();
        return readFile(m_path);
    }

private:
    void restore()
    {
        if (m_saved < 0) return;
        std::fflush(stderr);
        dup2(m_saved, 2);
        close(m_saved);
        m_saved = -1;
    }
    std::string m_path;
    int m_saved;
};

std::string table(const char* filter, int intValue)
{
    return std::string("{\"filter\":") + filter + ",\"entries\":[{\"rdType\":\"HTTP\",\"intValue\":" +
           std::to_string(intValue) + "}]}";
}

using FilterSpec = std::vector<std::pair<std::pair<uint16_t, uint16_t>, ZUB_CALLBACK>>;

class Zub1SimTest : public ::testing::Test {
protected:
    void SetUp() override
    {
        ASSERT_EQ(ZUB1SIM_Reset(), 0);
        for (const char* name : {"ZUB1_REPLAY", "ZUB1_THREADS", "ZUB1_STATUS_FILE", "ZUB1_REGISTER_FAILURES"}) {
            unsetenv(name);
        }
        setenv("ZUB1_START_DELAY_MS", "0", 1);
        g_rec = new Recorder;
        char dir[] = "/tmp/zub1sim_test.XXXXXX";
        ASSERT_NE(mkdtemp(dir), nullptr);
        m_dir = dir;
    }
    void TearDown() override
    {
        ZUB_APPL_ID appl = 0;
        g_rec->update([&] { appl = g_rec->appl; });
        if (appl != 0) ZUB1_UnregisterApplication(&appl);
        EXPECT_EQ(ZUB1SIM_Reset(), 0);  // joins the threads: no callback uses g_rec any more
        delete g_rec;
        std::filesystem::remove_all(m_dir);
    }
    // Registers and defines the filters before any table can arrive.
    ZUB_APPL_ID registerWith(const FilterSpec& filters)
    {
        ZUB1SIM_HoldDelivery(1);
        ZUB_APPL_ID appl = 0;
        EXPECT_EQ(ZUB1_RegisterApplication(&appl, "test", 0, 0), 0);
        EXPECT_NE(appl, 0u);
        for (const auto& filter : filters) {
            ZUB_FILTER_REQUEST request = defineRequest(filter.first.first, filter.first.second, filter.second);
            EXPECT_EQ(ZUB1_DefineFilter(&appl, &request), 0);
        }
        ZUB1SIM_HoldDelivery(0);
        g_rec->update([&] { g_rec->appl = appl; });
        return appl;
    }
    void forgetAppl()
    {
        g_rec->update([] { g_rec->appl = 0; });
    }
    static ZUB1SIM_STATS stats()
    {
        ZUB1SIM_STATS stats;
        ZUB1SIM_GetStats(&stats);
        return stats;
    }
    std::string m_dir;
};

// ---- Table building ----

// Field values by name, with offsets and widths written from the layout.
struct FieldRow {
    int entry;
    const char* name;
    const char* json;  // null: left out of the line (default value)
    size_t offset;
    char kind;         // 'u' u32, 'i' i32, 's' u16, 't' inline text, 'p' text reference
    long long number;
    const char* text;  // 't': bytes, NUL-padded to `width`; 'p': expected text, null = null reference
    size_t width;
};

const FieldRow FIELD_ROWS[] = {
    {0, "registeredFlag", "7", 12, 'u', 7, nullptr, 0},
    {0, "stampText", "\"Tue 2024-03-05 13:45:12 UTC\"", 16, 't', 0, "Tue 2024-03-05 13:45:12 UTC", 32},
    {0, "intValue", "-123456", 48, 'i', -123456, nullptr, 0},
    {0, "ulongValue", "4000000000", 52, 'u', 4000000000LL, nullptr, 0},
    {0, "textA", "\"client-a\"", 56, 't', 0, "client-a", 40},
    {0, "ushortA", "65535", 96, 's', 65535, nullptr, 0},
    {0, "ushortB", "8080", 98, 's', 8080, nullptr, 0},
    {0, "textB", "\"ABCDEFGHIJKLMNOP\"", 100, 't', 0, "ABCDEFGHIJKLMNOP", 16},  // full: no NUL
    {0, "textC", "\"server-c\"", 116, 't', 0, "server-c", 24},
    {0, "intMetric1", "11", 140, 'i', 11, nullptr, 0},
    {0, "intMetric2", "12", 144, 'i', 12, nullptr, 0},
    {0, "intMetric3", "-13", 148, 'i', -13, nullptr, 0},
    {0, "intMetric4", "14", 152, 'i', 14, nullptr, 0},
    {0, "intMetric5", "2147483647", 156, 'i', 2147483647, nullptr, 0},
    {0, "longMetric1", "21", 160, 'i', 21, nullptr, 0},
    {0, "longMetric2", "-2147483648", 164, 'i', -2147483648LL, nullptr, 0},
    {0, "longMetric3", "23", 168, 'i', 23, nullptr, 0},
    {0, "rdType", "\"HTTP\"", 188, 't', 0, "HTTP", 4},
    {0, "url", "\"http://www.example.com/a?b=1\"", 192, 'p', 0, "http://www.example.com/a?b=1", 0},
    {0, "detailText1", "\"d1\"", 196, 'p', 0, "d1", 0},
    {0, "detailText2", "\"d2\"", 200, 'p', 0, "d2", 0},
    {0, "detailText3", "\"d3\"", 204, 'p', 0, "d3", 0},
    {0, "title", "\"Example page\"", 212, 'p', 0, "Example page", 0},
    {0, "httpText", "\"GET\"", 216, 't', 0, "GET", 32},
    {0, "httpInt0", "100", 248, 'i', 100, nullptr, 0},
    {0, "httpInt1", "101", 252, 'i', 101, nullptr, 0},
    {0, "httpInt2", "102", 280, 'i', 102, nullptr, 0},
    {0, "httpInt3", "103", 284, 'i', 103, nullptr, 0},
    {0, "httpInt4", "104", 288, 'i', 104, nullptr, 0},
    {0, "httpInt5", "-105", 292, 'i', -105, nullptr, 0},
    {0, "httpInt6", "106", 296, 'i', 106, nullptr, 0},
    {0, "httpInt7", "107", 300, 'i', 107, nullptr, 0},
    {0, "httpEntryType", "2", 304, 'i', 2, nullptr, 0},
    {0, "httpInt8", "108", 308, 'i', 108, nullptr, 0},
    {0, "httpInt9", "109", 312, 'i', 109, nullptr, 0},
    {0, "httpInt10", "110", 316, 'i', 110, nullptr, 0},
    {0, "httpInt11", "111", 320, 'i', 111, nullptr, 0},
    {0, "httpInt12", "112", 324, 'i', 112, nullptr, 0},
    {1, "registeredFlag", nullptr, 12, 'u', 1, nullptr, 0},
    {1, "intValue", nullptr, 48, 'i', 0, nullptr, 0},
    {1, "textA", nullptr, 56, 't', 0, "", 40},
    {1, "rdType", "\"MSVD\"", 188, 't', 0, "MSVD", 4},
    {1, "url", "\"mms://media.example.com/clip.wmv\"", 192, 'p', 0, "mms://media.example.com/clip.wmv", 0},
    {1, "detailText1", "null", 196, 'p', 0, nullptr, 0},
    {1, "detailText2", nullptr, 200, 'p', 0, nullptr, 0},
    {1, "detailText3", "\"\"", 204, 'p', 0, "", 0},
    {1, "mediaText", "\"video/x-ms-wmv\"", 208, 't', 0, "video/x-ms-wmv", 32},
    {1, "mediaInt0", "-1", 240, 'i', -1, nullptr, 0},
    {1, "mediaInt1", "2", 260, 'i', 2, nullptr, 0},
    {1, "mediaInt2", "3", 264, 'i', 3, nullptr, 0},
    {2, "rdType", "\"TCP\"", 188, 't', 0, "TCP", 4},  // shorter code: NUL-padded
    {2, "registeredFlag", "0", 12, 'u', 0, nullptr, 0},
};

TEST_F(Zub1SimTest, EveryFieldLandsAtItsOffset)
{
    std::string line = "{\"filter\":[0,80],\"entries\":[";
    for (int entry = 0; entry < 3; ++entry) {
        std::string fields;
        for (const FieldRow& row : FIELD_ROWS) {
            if (row.entry != entry || row.json == nullptr) continue;
            fields += (fields.empty() ? "\"" : ",\"") + std::string(row.name) + "\":" + row.json;
        }
        line += (entry == 0 ? "{" : ",{") + fields + "}";
    }
    registerWith({{{0, 80}, capture<1>}});
    ASSERT_EQ(ZUB1SIM_DeliverLine((line + "]}").c_str()), 0);
    ASSERT_EQ(ZUB1SIM_WaitIdle(GUARD_MS), 0);

    ASSERT_EQ(g_rec->seen.size(), 1u);
    const Seen& seen = g_rec->seen[0];
    EXPECT_EQ(seen.entryCount, 3);
    EXPECT_EQ(seen.entriesOffset, 24);  // right behind the 24-byte header
    EXPECT_TRUE(seen.textsBehindEntries);
    ASSERT_EQ(seen.entries.size(), 3u);
    for (const FieldRow& row : FIELD_ROWS) {
        SCOPED_TRACE(std::string("entry ") + std::to_string(row.entry) + " field " + row.name);
        if (row.kind == 't') {
            std::string expected(row.text);
            expected.resize(row.width, '\0');
            const auto* at = reinterpret_cast<const char*>(seen.entries[row.entry].data()) + row.offset;
            EXPECT_EQ(std::string(at, row.width), expected);
        } else if (row.kind == 'p') {
            EXPECT_EQ(seen.texts[row.entry].at(row.offset), row.text ? Text(row.text) : Text());
        } else {
            long long value = seen.at<uint16_t>(row.entry, row.offset);
            if (row.kind == 'u') value = seen.at<uint32_t>(row.entry, row.offset);
            if (row.kind == 'i') value = seen.at<int32_t>(row.entry, row.offset);
            EXPECT_EQ(value, row.number);
        }
    }
    EXPECT_EQ(seen.entries[0][116], 's');  // the unterminated textB runs into textC
}

TEST_F(Zub1SimTest, EntryCountAndEmptyTables)
{
    const struct {
        const char* line;
        int32_t entryCount;
        long entriesOffset;  // -1: null entry pointer
    } rows[] = {
        {"{\"filter\":[0,80],\"entries\":[{},{},{}]}", 3, 24},
        {"{\"filter\":[0,80],\"entries\":[{},{}],\"entryCount\":1}", 1, 24},
        {"{\"filter\":[0,80],\"entries\":[{},{}],\"entryCount\":0}", 0, 24},
        {"{\"filter\":[0,80],\"entries\":[{}],\"entryCount\":-3}", -3, 24},
        {"{\"filter\":[0,80],\"entries\":[]}", 0, -1},
        {"{\"filter\":[0,80]}", 0, -1},
        {"{\"filter\":[0,80],\"entries\":[],\"entryCount\":-1}", -1, -1},
    };
    setenv("ZUB1_THREADS", "1", 1);  // one thread: callbacks in queue order
    registerWith({{{0, 80}, capture<1>}});
    for (const auto& row : rows) ASSERT_EQ(ZUB1SIM_DeliverLine(row.line), 0) << row.line;
    ASSERT_EQ(ZUB1SIM_WaitIdle(GUARD_MS), 0);
    ASSERT_EQ(g_rec->seen.size(), std::size(rows));
    for (size_t i = 0; i < std::size(rows); ++i) {
        EXPECT_EQ(g_rec->seen[i].entryCount, rows[i].entryCount) << rows[i].line;
        EXPECT_EQ(g_rec->seen[i].entriesOffset, rows[i].entriesOffset) << rows[i].line;
    }
}

// ---- Invalid script lines ----

const struct InvalidRow {
    const char* line;
    const char* message;  // expected after "<file>:<line>: "
} INVALID_ROWS[] = {
    {"{\"filter\":[0,80],\"entries\":[{\"foo\":1}]}", "unknown field \"foo\" in entry 0"},
    {"{\"filter\":[0,80],\"bar\":1}", "unknown field \"bar\""},
    {"{\"filter\":[0,80],\"entries\":[{\"textB\":\"ABCDEFGHIJKLMNOPQ\"}]}", "text too long for \"textB\""},
    {"{\"filter\":[0,80],\"entries\":[{\"rdType\":\"HTTPS\"}]}", "text too long for \"rdType\""},
    {"{\"filter\":[0,80],\"entries\":[{},{\"title\":\"t\",\"mediaInt0\":1}]}",
     "HTTP field \"title\" and media field \"mediaInt0\" both in entry 1"},
    {"{\"filter\":[0,80],\"entries\":[{}],\"entryCount\":2}", "entryCount 2 exceeds the 1 entries given"},
    {"{\"filter\":[0,80],", "invalid JSON"},
    {"{\"filter\":[0,80],\"entries\":[{\"ushortA\":65536}]}", "\"ushortA\" out of range"},
    {"{\"filter\":[0,80],\"entries\":[{\"registeredFlag\":-1}]}", "\"registeredFlag\" out of range"},
    {"{\"filter\":[0,80],\"entries\":[{\"intValue\":2147483648}]}", "\"intValue\" out of range"},
    {"{\"filter\":[0,80],\"entries\":[{\"ulongValue\":4294967296}]}", "\"ulongValue\" out of range"},
    {"{\"filter\":[0,80],\"entries\":[{\"intValue\":1.5}]}", "\"intValue\" must be an integer"},
    {"{\"filter\":[0,80],\"entries\":[{\"url\":7}]}", "\"url\" must be a string or null"},
    {"{\"filter\":[0,80],\"entries\":[{\"textA\":null}]}", "\"textA\" must be a string"},
    {"{\"filter\":[0,65536]}", "\"filter service\" out of range"},
    {"{\"filter\":[0]}", "\"filter\" must be [protocol, service]"},
    {"{\"entries\":[]}", "missing \"filter\""},
    {"[1,2]", "a table line must be a JSON object"},
};

TEST_F(Zub1SimTest, InvalidLinesAreReportedAndSkipped)
{
    const std::string script = m_dir + "/script.jsonl";
    {
        std::ofstream out(script);
        out << table("[0,80]", 1) << "\n# a comment\n\n";  // lines 1 to 3
        for (const InvalidRow& row : INVALID_ROWS) out << row.line << "\n";
        out << "  # an indented comment\n" << table("[0,80]", 2) << "\n";
    }
    setenv("ZUB1_REPLAY", script.c_str(), 1);
    setenv("ZUB1_THREADS", "1", 1);
    StderrCapture err(m_dir + "/stderr.txt");
    registerWith({{{0, 80}, capture<1>}});
    ASSERT_EQ(ZUB1SIM_WaitIdle(GUARD_MS), 0);
    // The same lines handed over one by one.
    for (const InvalidRow& row : INVALID_ROWS) EXPECT_EQ(ZUB1SIM_DeliverLine(row.line), -1) << row.line;
    const std::string errors = err.text();

    for (size_t i = 0; i < std::size(INVALID_ROWS); ++i) {
        for (const std::string& where :
             {script + ":" + std::to_string(i + 4), "ZUB1SIM_DeliverLine:" + std::to_string(i + 1)}) {
            const std::string expected = "zub1api: " + where + ": " + INVALID_ROWS[i].message;
            EXPECT_NE(errors.find(expected), std::string::npos) << expected << "\nin:\n" << errors;
        }
    }
    EXPECT_EQ(stats().invalid, 2 * std::size(INVALID_ROWS));
    EXPECT_EQ(stats().tables, 2u);
    ASSERT_EQ(g_rec->seen.size(), 2u);
    EXPECT_EQ(g_rec->seen[0].at<int32_t>(0, 48), 1);
    EXPECT_EQ(g_rec->seen[1].at<int32_t>(0, 48), 2);
}

TEST_F(Zub1SimTest, MissingScriptIsReportedAndEndsTheScript)
{
    const std::string script = m_dir + "/missing.jsonl";
    setenv("ZUB1_REPLAY", script.c_str(), 1);
    StderrCapture err(m_dir + "/stderr.txt");
    registerWith({{{0, 80}, capture<1>}});
    ASSERT_EQ(ZUB1SIM_WaitIdle(GUARD_MS), 0);
    EXPECT_NE(err.text().find("zub1api: " + script + ": cannot open"), std::string::npos);
}

// ---- Filters and registration ----

TEST_F(Zub1SimTest, TablesGoToTheMatchingFilter)
{
    const ZUB_APPL_ID appl = registerWith({{{0, 80}, capture<1>}, {{1, 0}, capture<2>}});
    ZUB1SIM_FILTER filters[4];
    ASSERT_EQ(ZUB1SIM_GetFilters(filters, 4), 2);
    EXPECT_EQ(filters[0].applId, appl);
    EXPECT_EQ(filters[0].protocol, 0);
    EXPECT_EQ(filters[0].service, 80);
    EXPECT_EQ(filters[0].callback, &capture<1>);
    EXPECT_EQ(filters[1].protocol, 1);
    EXPECT_EQ(filters[1].service, 0);
    EXPECT_EQ(filters[1].callback, &capture<2>);

    for (const char* filter : {"[0,80]", "[1,0]", "[5,0]", "[0,443]", "[0,80]"}) {
        ASSERT_EQ(ZUB1SIM_DeliverLine(table(filter, 0).c_str()), 0);
    }
    ASSERT_EQ(ZUB1SIM_WaitIdle(GUARD_MS), 0);
    const auto count = [](int callback) {
        return std::count_if(g_rec->seen.begin(), g_rec->seen.end(), [&](const Seen& s) { return s.callback == callback; });
    };
    EXPECT_EQ(count(1), 2);
    EXPECT_EQ(count(2), 1);
    EXPECT_EQ(stats().unmatched, 2u);
    EXPECT_EQ(stats().freed, 3u);

    // A removal names the filter by the id the library gave it.
    ZUB_FILTER_REQUEST remove;
    std::memset(&remove, 0, sizeof remove);
    remove.requestType = ZUB_REQ_REMOVE_FILTER;
    remove.level = ZUB_REQ_LEVEL;
    remove.filterId = filters[1].filterId;
    ZUB_APPL_ID id = appl;
    EXPECT_EQ(ZUB1_DefineFilter(&id, &remove), 0);
    EXPECT_EQ(ZUB1SIM_GetFilters(filters, 4), 1);
    StderrCapture err(m_dir + "/stderr.txt");
    EXPECT_NE(ZUB1_DefineFilter(&id, &remove), 0);  // already gone
    EXPECT_NE(err.text().find("has no filter"), std::string::npos);
}

TEST_F(Zub1SimTest, BadFilterRequestsAreRefused)
{
    const struct {
        const char* what;
        void (*spoil)(ZUB_FILTER_REQUEST&);
    } rows[] = {
        {"level 2", [](ZUB_FILTER_REQUEST& r) { r.level = 2; }},
        {"no callback flag", [](ZUB_FILTER_REQUEST& r) { r.flags = 0; }},
        {"null callback", [](ZUB_FILTER_REQUEST& r) { r.callback = nullptr; }},
        {"request type 1", [](ZUB_FILTER_REQUEST& r) { r.requestType = 1; }},
        {"define naming a filter id", [](ZUB_FILTER_REQUEST& r) { r.filterId = 5; }},
        {"reserved byte set", [](ZUB_FILTER_REQUEST& r) { r.reserved[40] = 1; }},
#if UINTPTR_MAX > 0xffffffffu
        {"bytes 68 to 71 set", [](ZUB_FILTER_REQUEST& r) { r.reserved64 = 1; }},
#endif
        {"remove without filter id", [](ZUB_FILTER_REQUEST& r) { r.requestType = ZUB_REQ_REMOVE_FILTER; }},
    };
    ZUB_APPL_ID appl = registerWith({});
    StderrCapture err(m_dir + "/stderr.txt");
    for (const auto& row : rows) {
        ZUB_FILTER_REQUEST request = defineRequest(0, 80, capture<1>);
        row.spoil(request);
        EXPECT_NE(ZUB1_DefineFilter(&appl, &request), 0) << row.what;
    }
    ZUB_FILTER_REQUEST good = defineRequest(0, 80, capture<1>);
    ZUB_APPL_ID stranger = appl + 1000;
    EXPECT_NE(ZUB1_DefineFilter(&stranger, &good), 0) << "unknown application";
    EXPECT_NE(ZUB1_DefineFilter(&appl, nullptr), 0) << "null request";
    EXPECT_EQ(ZUB1SIM_GetFilters(nullptr, 0), 0);
}

TEST_F(Zub1SimTest, RefusedRegistrationsLeaveTheIdAlone)
{
    setenv("ZUB1_REGISTER_FAILURES", "3", 1);
    StderrCapture err(m_dir + "/stderr.txt");
    for (int attempt = 1; attempt <= 3; ++attempt) {
        ZUB_APPL_ID appl = 0;
        EXPECT_NE(ZUB1_RegisterApplication(&appl, "test", 0, 0), 0) << "attempt " << attempt;
        EXPECT_EQ(appl, 0u) << "attempt " << attempt;
    }
    EXPECT_NE(err.text().find("refused as ZUB1_REGISTER_FAILURES asks (0 more)"), std::string::npos);
    registerWith({});
    EXPECT_EQ(stats().refusals, 3u);
    EXPECT_EQ(stats().registrations, 1u);
}

TEST_F(Zub1SimTest, DeliveryPausesWhileNoApplicationIsRegistered)
{
    setenv("ZUB1_THREADS", "1", 1);
    registerWith({{{0, 80}, dropOnFlagZero}});
    ASSERT_EQ(ZUB1SIM_DeliverLine(table("[0,80]", 1).c_str()), 0);
    ASSERT_EQ(ZUB1SIM_DeliverLine("{\"filter\":[0,80],\"entries\":[{\"registeredFlag\":0,\"intValue\":2}]}"), 0);
    ASSERT_EQ(ZUB1SIM_DeliverLine(table("[0,80]", 3).c_str()), 0);
    ASSERT_EQ(ZUB1SIM_DeliverLine(table("[0,80]", 4).c_str()), 0);
    ASSERT_TRUE(g_rec->waitFor([] { return g_rec->seen.size() >= 2; }));
    EXPECT_EQ(g_rec->unregisterRcs, std::vector<int>{0});
    forgetAppl();
    // Unregistered: the two tables left stay queued, none is dropped.
    EXPECT_EQ(stats().delivered, 2u);
    EXPECT_EQ(stats().unmatched, 0u);
    EXPECT_EQ(ZUB1SIM_WaitIdle(0), -1);

    registerWith({{{0, 80}, dropOnFlagZero}});
    ASSERT_EQ(ZUB1SIM_WaitIdle(GUARD_MS), 0);
    EXPECT_EQ(stats().unmatched, 0u);
    ASSERT_EQ(g_rec->seen.size(), 4u);
    for (int i = 0; i < 4; ++i) EXPECT_EQ(g_rec->seen[i].at<int32_t>(0, 48), i + 1) << "script order";
}

// ---- Concurrency ----

TEST_F(Zub1SimTest, EveryTableIsFreedOnceUnderConcurrentDelivery)
{
    setenv("ZUB1_THREADS", "4", 1);
    registerWith({{{0, 80}, capture<1>}, {{1, 0}, capture<2>}});
    for (int i = 0; i < 200; ++i) ASSERT_EQ(ZUB1SIM_DeliverLine(table(i % 2 ? "[1,0]" : "[0,80]", i).c_str()), 0);
    ASSERT_EQ(ZUB1SIM_WaitIdle(GUARD_MS), 0);
    const ZUB1SIM_STATS s = stats();
    EXPECT_EQ(s.delivered, 200u);
    EXPECT_EQ(s.freed, 200u);
    EXPECT_EQ(s.badFrees, 0u);
    std::vector<int> times(200, 0);
    for (const Seen& seen : g_rec->seen) {
        const int32_t value = seen.at<int32_t>(0, 48);
        EXPECT_EQ(seen.callback, value % 2 ? 2 : 1) << "table " << value;
        ++times.at(value);
    }
    EXPECT_EQ(std::count(times.begin(), times.end(), 1), 200);
}

TEST_F(Zub1SimTest, TablesOfOneFilterArriveConcurrently)
{
    setenv("ZUB1_THREADS", "2", 1);
    registerWith({{{0, 80}, rendezvous}});
    ASSERT_EQ(ZUB1SIM_DeliverLine(table("[0,80]", 1).c_str()), 0);
    ASSERT_EQ(ZUB1SIM_DeliverLine(table("[0,80]", 2).c_str()), 0);
    ASSERT_EQ(ZUB1SIM_WaitIdle(GUARD_MS), 0);
    EXPECT_EQ(g_rec->metPartner, (std::vector<bool>{true, true}));
}

TEST_F(Zub1SimTest, GivingBackTwiceOrAForeignPointerIsCountedNotFatal)
{
    registerWith({{{0, 80}, keepTable}});
    ASSERT_EQ(ZUB1SIM_DeliverLine(table("[0,80]", 1).c_str()), 0);
    ASSERT_TRUE(g_rec->waitFor([] { return g_rec->kept != nullptr; }));
    int local = 0;
    StderrCapture err(m_dir + "/stderr.txt");
    EXPECT_EQ(ZUB1_FreeResponseTimeResult(g_rec->kept), 0);
    EXPECT_NE(ZUB1_FreeResponseTimeResult(g_rec->kept), 0);
    EXPECT_NE(ZUB1_FreeResponseTimeResult(&local), 0);
    EXPECT_NE(ZUB1_FreeResponseTimeResult(nullptr), 0);
    EXPECT_NE(err.text().find("is not a delivered table"), std::string::npos);
    EXPECT_EQ(stats().freed, 1u);
    EXPECT_EQ(stats().badFrees, 3u);
}

TEST_F(Zub1SimTest, UnregisterWaitsForARunningCallback)
{
    ZUB_APPL_ID appl = registerWith({{{0, 80}, slowCallback}});
    ASSERT_EQ(ZUB1SIM_DeliverLine(table("[0,80]", 1).c_str()), 0);
    ASSERT_TRUE(g_rec->waitFor([] { return g_rec->arrived == 1; }));
    std::thread releaser([] { g_rec->update([] { g_rec->release = true; }); });
    EXPECT_EQ(ZUB1_UnregisterApplication(&appl), 0);
    g_rec->update([] { EXPECT_TRUE(g_rec->finished); });
    forgetAppl();
    releaser.join();
}

TEST_F(Zub1SimTest, UnregisterInsideACallbackWaitsForTheOthersOnly)
{
    setenv("ZUB1_THREADS", "2", 1);
    registerWith({{{0, 80}, unregisteringCallback}, {{1, 0}, slowCallback}});
    ASSERT_EQ(ZUB1SIM_DeliverLine(table("[0,80]", 1).c_str()), 0);
    ASSERT_EQ(ZUB1SIM_DeliverLine(table("[1,0]", 2).c_str()), 0);
    ASSERT_TRUE(g_rec->waitFor([] { return !g_rec->unregisterRcs.empty(); }));
    g_rec->update([] {
        EXPECT_EQ(g_rec->unregisterRcs, std::vector<int>{0});
        EXPECT_TRUE(g_rec->finishedAtUnregister) << "returned while the other callback ran";
    });
    forgetAppl();
    // Ended: nothing more arrives, new tables wait for a registration.
    ASSERT_EQ(ZUB1SIM_DeliverLine(table("[0,80]", 3).c_str()), 0);
    EXPECT_EQ(ZUB1SIM_GetFilters(nullptr, 0), 0);
    EXPECT_EQ(stats().delivered, 2u);
    EXPECT_EQ(ZUB1SIM_WaitIdle(0), -1);
}

TEST_F(Zub1SimTest, TwoCallbacksUnregisteringTogetherDoNotDeadlock)
{
    setenv("ZUB1_THREADS", "2", 1);
    registerWith({{{0, 80}, rendezvousThenUnregister}});
    ASSERT_EQ(ZUB1SIM_DeliverLine(table("[0,80]", 1).c_str()), 0);
    ASSERT_EQ(ZUB1SIM_DeliverLine(table("[0,80]", 2).c_str()), 0);
    ASSERT_TRUE(g_rec->waitFor([] { return g_rec->unregisterRcs.size() == 2; }));
    g_rec->update([] {
        EXPECT_EQ(g_rec->unregisterRcs, (std::vector<int>{0, 0}));
        EXPECT_EQ(g_rec->metPartner, (std::vector<bool>{true, true}));
    });
    EXPECT_EQ(stats().unregistrations, 1u);
    forgetAppl();
}

// ---- Status file, bundled script, process exit ----

TEST_F(Zub1SimTest, StatusFileIsWrittenWhenAllIsGivenBack)
{
    const std::string script = m_dir + "/script.jsonl";
    const std::string status = m_dir + "/status.json";
    std::ofstream(script) << table("[0,80]", 1) << "\n" << table("[1,0]", 2) << "\n{\"bad\":1}\n"
                          << table("[0,80]", 3) << "\n";
    setenv("ZUB1_REPLAY", script.c_str(), 1);
    setenv("ZUB1_STATUS_FILE", status.c_str(), 1);
    StderrCapture err(m_dir + "/stderr.txt");
    registerWith({{{0, 80}, capture<1>}});
    ASSERT_EQ(ZUB1SIM_WaitIdle(GUARD_MS), 0);
    const std::string text = readFile(status);
    for (const char* field :
         {"\"tables\":3", "\"delivered\":2", "\"freed\":2", "\"unmatched\":1", "\"invalid\":1", "\"badFrees\":0"}) {
        EXPECT_NE(text.find(field), std::string::npos) << field << " in " << text;
    }
    EXPECT_FALSE(std::filesystem::exists(status + ".tmp"));

    // A later change while idle is written too.
    EXPECT_EQ(ZUB1SIM_DeliverLine("{\"bad\":2}"), -1);
    ASSERT_EQ(ZUB1SIM_WaitIdle(GUARD_MS), 0);
    EXPECT_NE(readFile(status).find("\"invalid\":2"), std::string::npos) << readFile(status);
}

TEST_F(Zub1SimTest, BundledDemoScriptIsValid)
{
    setenv("ZUB1_REPLAY", WQ5_SOURCE_DIR "/samples/demo.jsonl", 1);
    registerWith({{{0, 80}, capture<1>}, {{0, 443}, capture<1>}, {{1, 0}, capture<2>}, {{5, 0}, capture<2>}});
    ASSERT_EQ(ZUB1SIM_WaitIdle(GUARD_MS), 0);
    EXPECT_EQ(stats().invalid, 0u);
    EXPECT_EQ(stats().tables, 6u);  // three HTTP pages, one secure page, one video, one audio table
    EXPECT_EQ(stats().unmatched, 0u);
    for (const Seen& seen : g_rec->seen) {
        for (const std::vector<unsigned char>& entry : seen.entries) {
            const std::string code(reinterpret_cast<const char*>(entry.data()) + 188, 4);
            EXPECT_TRUE(seen.callback == 1 ? code == "HTTP" : code == "MSVD" || code == "MSAU") << code;
            const std::string stamp(reinterpret_cast<const char*>(entry.data()) + 16);
            EXPECT_EQ(stamp.substr(4, 10), "2024-03-05") << stamp;  // date from position 4
            EXPECT_EQ(stamp.substr(15, 8).find_first_not_of("0123456789:"), std::string::npos) << stamp;
        }
    }
}

TEST_F(Zub1SimTest, ProcessExitsCleanlyWhileRegistered)
{
    std::fflush(stdout);
    std::fflush(stderr);
    const pid_t child = fork();
    ASSERT_GE(child, 0);
    if (child == 0) {
        ZUB_APPL_ID appl = 0;
        if (ZUB1_RegisterApplication(&appl, "child", 0, 0) != 0) _exit(2);
        ZUB_FILTER_REQUEST keep = defineRequest(0, 80, keepTable);
        ZUB_FILTER_REQUEST record = defineRequest(1, 0, capture<1>);
        if (ZUB1_DefineFilter(&appl, &keep) != 0 || ZUB1_DefineFilter(&appl, &record) != 0) _exit(3);
        for (int i = 0; i < 20; ++i) ZUB1SIM_DeliverLine(table(i % 2 ? "[1,0]" : "[0,80]", i).c_str());
        std::exit(0);  // still registered, tables queued, one held
    }
    int status = 0;
    ASSERT_EQ(waitpid(child, &status, 0), child);
    ASSERT_TRUE(WIFEXITED(status));
    EXPECT_EQ(WEXITSTATUS(status), 0) << "a sanitizer reported at exit, or the child failed";
}

}  // namespace

#include "workload.h"

#include <cstdio>
#include <cstdlib>
#include <filesystem>
#include <fstream>
#include <sstream>
#include <stdexcept>

#include "src/mfmgr.h"

namespace wq5bench {

namespace {

// The measured texts of one entry; the numbers are derived from its index.
struct PageView {
    int entryType;         // 1 = page, 2 = object
    const char* url;       // about 80 characters, as pages and assets have
    const char* title;     // null: none
    const char* mimeType;  // detailText1
    const char* referer;   // detailText3, null: none
};

const char* const AGENT = "Mozilla/5.0 (Windows NT 10.0; Win64; x64; rv:123.0) Gecko/20100101 Firefox/123.0";
const char* const PAGE_URL = "http://www.tentshop.example.com/catalogue/camping/tents/index.html?sort=price";

const PageView VIEW[RECORDS_PER_TABLE] = {
    {1, PAGE_URL, "Tents for four people - Camping - Outdoor Shop", "text/html; charset=utf-8",
     "http://search.example.org/results?q=four+person+tent&src=home"},
    {2, "http://static.tentshop.example.com/assets/css/catalogue.min.css?v=20240305a1", "NO_TITLE_FOUND",
     "text/css", PAGE_URL},
    {2, "http://static.tentshop.example.com/assets/js/vendor/jquery-3.7.1.min.js?v=3", nullptr,
     "application/javascript", PAGE_URL},
    {2, "http://static.tentshop.example.com/assets/js/catalogue-filters.js?build=8812", nullptr,
     "application/javascript", PAGE_URL},
    {2, "http://img.tentshop.example.com/products/tents/trailhead-4p/front-800x600.jpg", nullptr,
     "image/jpeg", PAGE_URL},
    {2, "http://img.tentshop.example.com/products/tents/summit-2p/front-800x600.jpg", nullptr, "image/jpeg",
     PAGE_URL},
    {2, "http://img.tentshop.example.com/products/tents/basecamp-6p/front-800x600.jpg", nullptr,
     "image/jpeg", PAGE_URL},
    {2, "http://static.tentshop.example.com/assets/fonts/opensans-regular.woff2#v2", "NO_TITLE_FOUND",
     "font/woff2", PAGE_URL},
    {2, "http://www.tentshop.example.com/api/v2/stock?ids=8812,8813,8814&region=eu", nullptr,
     "application/json", PAGE_URL},
    {2, "http://metrics.tentshop.example.com/collect/pixel.gif?page=tents&ref=search", nullptr, "image/gif",
     PAGE_URL},
};

// The numbers of entry `i`: sizes and times that differ per object.
void setNumbers(ZUB_RESPONSE_TIME_DATA& e, int i)
{
    const int32_t size = 1200 + 7919 * i;
    const int32_t millis = 40 + 13 * i;
    const bool page = i == 0;
    e.ulongValue = 100000 + i;
    e.intValue = millis;
    e.ushortA = static_cast<uint16_t>(52311 + i);
    e.ushortB = 80;
    e.intMetric1 = millis - 20;
    e.intMetric2 = page ? 35 : 0;
    e.intMetric3 = page ? 12 : 0;
    e.intMetric4 = 20;
    e.intMetric5 = millis - 40;
    e.longMetric1 = size;
    e.longMetric2 = 1460;
    e.longMetric3 = 0;
    ZUB_HTTP_DETAIL& h = e.detail.view.http;
    h.httpInt0 = 200;
    h.httpInt1 = size;
    h.httpInt2 = millis;
    h.httpInt3 = e.intMetric2;
    h.httpInt4 = e.intMetric3;
    h.httpInt5 = 0;
    h.httpInt6 = 1;
    h.httpInt7 = page ? 9 : 0;
    h.httpInt8 = 20;
    h.httpInt9 = millis - 20;
    h.httpInt10 = size;
    h.httpInt11 = 410 + i;
    h.httpInt12 = page ? 1 : 0;
}

const char* const STAMP = "Tue 2024-03-05 13:45:12 UTC";
const char* const CLIENT = "ws0142.corp.example.net";
const char* const ADDRESS = "10.20.30.41";
const char* const SERVER = "www.tentshop.example.com";

void appendJsonText(std::ostringstream& out, const char* name, const char* text)
{
    out << ",\"" << name << "\":";
    if (text == nullptr) {
        out << "null";
        return;
    }
    out << '"';
    for (const char* c = text; *c != '\0'; ++c) {
        if (*c == '"' || *c == '\\')
            out << '\\';
        out << *c;
    }
    out << '"';
}

}  // namespace

std::unique_ptr<wq5test::TableBuilder> buildTable()
{
    std::unique_ptr<wq5test::TableBuilder> table(new wq5test::TableBuilder(RECORDS_PER_TABLE));
    for (int i = 0; i < RECORDS_PER_TABLE; ++i) {
        ZUB_RESPONSE_TIME_DATA& e = table->entry(i);
        const PageView& v = VIEW[i];
        wq5test::setType(e, "HTTP");
        wq5test::setField(e.stampText, STAMP);
        wq5test::setField(e.textA, CLIENT);
        wq5test::setField(e.textB, ADDRESS);
        wq5test::setField(e.textC, SERVER);
        wq5test::setField(e.detail.view.http.httpText, "GET");
        e.detail.view.http.httpEntryType = v.entryType;
        setNumbers(e, i);
        table->setText(i, e.detail.url, v.url);
        table->setText(i, e.detail.detailText1, v.mimeType);
        table->setText(i, e.detail.detailText2, AGENT);
        if (v.referer != nullptr)
            table->setText(i, e.detail.detailText3, v.referer);
        if (v.title != nullptr)
            table->setText(i, e.detail.view.http.title, v.title);
    }
    return table;
}

// A number field of the entry under its name in the table layout.
#define WQ5_NUMBER(record, field) << ",\"" #field "\":" << static_cast<long>((record).field)

std::string tableScriptLine()
{
    // Read back from the table in memory, so that both carry the same data.
    std::unique_ptr<wq5test::TableBuilder> table = buildTable();
    std::ostringstream out;
    out << "{\"filter\":[0,80],\"entries\":[";
    for (int i = 0; i < RECORDS_PER_TABLE; ++i) {
        const ZUB_RESPONSE_TIME_DATA& e = table->entry(i);
        const ZUB_HTTP_DETAIL& h = e.detail.view.http;
        const PageView& v = VIEW[i];
        out << (i > 0 ? ",{" : "{") << "\"rdType\":\"HTTP\"";
        appendJsonText(out, "stampText", STAMP);
        appendJsonText(out, "textA", CLIENT);
        appendJsonText(out, "textB", ADDRESS);
        appendJsonText(out, "textC", SERVER);
        appendJsonText(out, "httpText", "GET");
        appendJsonText(out, "url", v.url);
        appendJsonText(out, "detailText1", v.mimeType);
        appendJsonText(out, "detailText2", AGENT);
        appendJsonText(out, "detailText3", v.referer);
        appendJsonText(out, "title", v.title);
        out WQ5_NUMBER(e, ulongValue) WQ5_NUMBER(e, intValue) WQ5_NUMBER(e, ushortA) WQ5_NUMBER(e, ushortB)
            WQ5_NUMBER(e, intMetric1) WQ5_NUMBER(e, intMetric2) WQ5_NUMBER(e, intMetric3)
            WQ5_NUMBER(e, intMetric4) WQ5_NUMBER(e, intMetric5) WQ5_NUMBER(e, longMetric1)
            WQ5_NUMBER(e, longMetric2) WQ5_NUMBER(e, longMetric3) WQ5_NUMBER(h, httpEntryType)
            WQ5_NUMBER(h, httpInt0) WQ5_NUMBER(h, httpInt1) WQ5_NUMBER(h, httpInt2) WQ5_NUMBER(h, httpInt3)
            WQ5_NUMBER(h, httpInt4) WQ5_NUMBER(h, httpInt5) WQ5_NUMBER(h, httpInt6) WQ5_NUMBER(h, httpInt7)
            WQ5_NUMBER(h, httpInt8) WQ5_NUMBER(h, httpInt9) WQ5_NUMBER(h, httpInt10)
            WQ5_NUMBER(h, httpInt11) WQ5_NUMBER(h, httpInt12);
        out << '}';
    }
    out << "]}";
    return out.str();
}

#undef WQ5_NUMBER

std::string captureHar()
{
    std::ostringstream out;
    out << "{\"log\":{\"version\":\"1.2\",\"creator\":{\"name\":\"wq5bench\",\"version\":\"1\"},"
        << "\"pages\":[{\"id\":\"page_1\",\"startedDateTime\":\"2024-03-05T13:45:12.104Z\"";
    appendJsonText(out, "title", VIEW[0].title);
    out << ",\"pageTimings\":{\"onContentLoad\":612,\"onLoad\":1187}}],\"entries\":[";
    for (int i = 0; i < RECORDS_PER_TABLE; ++i) {
        const PageView& v = VIEW[i];
        const int size = 1200 + 7919 * i;
        const int wait = 20 + 13 * i;
        char started[40];
        snprintf(started, sizeof started, "2024-03-05T13:45:12.%03dZ", 104 + 40 * i);
        out << (i > 0 ? "," : "") << "{\"pageref\":\"page_1\",\"startedDateTime\":\"" << started
            << "\",\"time\":" << wait + 21 << ",\"request\":{\"method\":\"GET\"";
        appendJsonText(out, "url", v.url);
        out << ",\"httpVersion\":\"HTTP/1.1\",\"cookies\":[],\"headers\":[{\"name\":\"User-Agent\"";
        appendJsonText(out, "value", AGENT);
        out << "}],\"queryString\":[],\"headersSize\":388,\"bodySize\":0},"
            << "\"response\":{\"status\":200,\"statusText\":\"OK\",\"httpVersion\":\"HTTP/1.1\",\"cookies\":[],"
            << "\"headers\":[],\"content\":{\"size\":" << size;
        appendJsonText(out, "mimeType", v.mimeType);
        out << "},\"redirectURL\":\"\",\"headersSize\":290,\"bodySize\":" << size << "},\"cache\":{},"
            << "\"timings\":{\"blocked\":1,\"dns\":" << (i == 0 ? 12 : -1) << ",\"connect\":" << (i == 0 ? 35 : -1)
            << ",\"ssl\":-1,\"send\":0,\"wait\":" << wait << ",\"receive\":20},"
            << "\"serverIPAddress\":\"192.0.2.10\",\"connection\":\"" << 52311 + i << "\"}";
    }
    out << "]}}";
    return out.str();
}

TempDir::TempDir(const char* purpose)
{
    const char* base = std::getenv("TMPDIR");
    std::string pattern = std::string(base != nullptr && base[0] != '\0' ? base : "/tmp") + "/wq5bench-" +
                          purpose + ".XXXXXX";
    if (mkdtemp(&pattern[0]) == nullptr)
        throw std::runtime_error("cannot make a temporary directory from " + pattern);
    m_path = pattern;
}

TempDir::~TempDir()
{
    std::error_code ignored;
    std::filesystem::remove_all(m_path, ignored);
}

Collector::Collector(const std::string& logDir, long maxSizeMb)
{
    static const char* const SETTINGS[] = {
        "WQ5_WORK_PATH", "WQ5_COLLECTOR_ID", "WQ5_LOG_DIR", "WQ5_LOG_KEEPDAYS", "WQ5_LOG_SAMPLE_PERCENTAGE",
        "WQ5_LOG_MAX_SIZE_MB", "WQ5_LOG_HTTP", "WQ5_LOG_HTTPOBJ", "WQ5_LOG_HTTPS", "WQ5_LOG_MS_VIDEO",
        "WQ5_LOG_MS_AUDIO", "WQ5_LOG_REAL_VIDEO", "WQ5_LOG_REAL_AUDIO", "WQ5_LOG_QUICKTIME",
        "WQ5_FIELD_DELIMITER", "WQ5_SUB_CHAR"};
    for (const char* name : SETTINGS)
        unsetenv(name);
    setenv("WQ5_COLLECTOR_ID", "bench01", 1);
    setenv("WQ5_LOG_DIR", logDir.c_str(), 1);
    setenv("WQ5_LOG_HTTP", "Y", 1);
    setenv("WQ5_LOG_HTTPOBJ", "Y", 1);
    setenv("WQ5_LOG_MAX_SIZE_MB", std::to_string(maxSizeMb).c_str(), 1);
    FilterManager::destroyInstance();
    m_handler.reset(new DataHandler(FilterManager::instance()));
}

Collector::~Collector()
{
    m_handler.reset();
    FilterManager::destroyInstance();
}

std::vector<std::string> recordLines()
{
    TempDir dir("records");
    {
        Collector collector(dir.path(), 0);
        collector.handler().processHttp(buildTable()->table());
    }
    std::vector<std::string> lines;
    for (const auto& file : std::filesystem::directory_iterator(dir.path())) {
        std::ifstream in(file.path());
        for (std::string line; std::getline(in, line);)
            lines.push_back(line + "\n");
    }
    if (lines.size() != RECORDS_PER_TABLE)
        throw std::runtime_error("the collector wrote " + std::to_string(lines.size()) + " records for one table, not " +
                                 std::to_string(RECORDS_PER_TABLE));
    return lines;
}

size_t tableBytes(const std::vector<std::string>& records)
{
    size_t bytes = 0;
    for (const std::string& r : records)
        bytes += r.size();
    return bytes;
}

}  // namespace wq5bench

// Tables processed on several threads at once: every record reaches the log
// whole, none is lost, objects keep their page's GUID, and a shared
// sampler keeps its exact count.
#include <gtest/gtest.h>

#include <algorithm>
#include <map>
#include <set>
#include <string>
#include <thread>
#include <vector>

#include "support/handler_fixture.h"
#include "support/table_builder.h"

namespace {

using wq5test::HandlerFixture;
using wq5test::Settings;
using wq5test::setType;
using wq5test::TableBuilder;
typedef DataHandlerTestAccess Access;

const int HTTP_THREADS = 3;
const int MEDIA_THREADS = 2;
const int TABLES_PER_THREAD = 150;
const int OBJECTS_PER_PAGE = 3;

// A table of one page and its objects, all marked with `site` and `page`
// in their URLs: http://s<site>/p<page>, http://s<site>/p<page>/o<n>.
void makeHttpTable(TableBuilder& b, int site, int page)
{
    const std::string base = "http://s" + std::to_string(site) + "/p" + std::to_string(page);
    for (int i = 0; i < b.count(); ++i) {
        ZUB_RESPONSE_TIME_DATA& e = b.entry(i);
        setType(e, "HTTP");
        e.detail.view.http.httpEntryType = i == 0 ? 1 : 2;
        b.setText(i, e.detail.url, i == 0 ? base : base + "/o" + std::to_string(i));
    }
}

void makeMediaTable(TableBuilder& b, const char* code)
{
    for (int i = 0; i < b.count(); ++i)
        setType(b.entry(i), code);
}

std::vector<std::string> split(const std::string& line, char delimiter)
{
    std::vector<std::string> columns;
    std::string::size_type start = 0;
    for (;;) {
        std::string::size_type at = line.find(delimiter, start);
        columns.push_back(line.substr(start, at == std::string::npos ? std::string::npos : at - start));
        if (at == std::string::npos)
            return columns;
        start = at + 1;
    }
}

// The tag of a whole line "<tag>...</tag>\n", or "" when it is not whole.
std::string wholeTag(const std::string& line)
{
    const std::string::size_type close = line.find('>');
    if (line.empty() || line[0] != '<' || close == std::string::npos)
        return "";
    const std::string tag = line.substr(1, close - 1);
    const std::string footer = "</" + tag + ">\n";
    if (line.size() < footer.size() || line.compare(line.size() - footer.size(), footer.size(), footer) != 0)
        return "";
    return tag;
}

TEST(ConcurrentRecords, EveryRecordWholeNoneLostObjectsKeepTheirPage)
{
    HandlerFixture fixture(Settings{{"WQ5_LOG_HTTP", "Y"}, {"WQ5_LOG_HTTPOBJ", "Y"}});
    DataHandler& handler = fixture.handler();

    std::vector<std::thread> threads;
    for (int t = 0; t < HTTP_THREADS; ++t) {
        threads.emplace_back([&handler, t] {
            for (int k = 0; k < TABLES_PER_THREAD; ++k) {
                TableBuilder b(1 + OBJECTS_PER_PAGE);
                makeHttpTable(b, t, k);
                handler.processHttp(b.table());
            }
        });
    }
    for (int t = 0; t < MEDIA_THREADS; ++t) {
        threads.emplace_back([&handler, t] {
            for (int k = 0; k < TABLES_PER_THREAD; ++k) {
                TableBuilder b(2);
                makeMediaTable(b, t == 0 ? "MSVD" : "MSAU");
                if (t == 0)
                    handler.processVideo(b.table());
                else
                    handler.processAudio(b.table());
            }
        });
    }
    for (std::thread& t : threads)
        t.join();

    std::map<std::string, int> perTag;
    std::map<std::string, std::string> guidOfPage;     // page URL -> GUID of its page record
    std::map<std::string, std::set<std::string>> objectGuids;  // page URL -> GUIDs of its objects
    std::set<std::string> allGuids;
    int lineNumber = 0;
    for (const std::string& line : wq5test::lines(fixture.log())) {
        ++lineNumber;
        const std::string tag = wholeTag(line);
        ASSERT_NE("", tag) << "line " << lineNumber << " is not whole: " << line;
        ++perTag[tag];
        const std::string body = line.substr(tag.size() + 2, line.size() - 2 * tag.size() - 6);
        const std::vector<std::string> columns = split(body, '^');
        const bool http = tag == "hpage" || tag == "hobj";
        ASSERT_EQ(http ? 46u : 31u, columns.size()) << "line " << lineNumber << ": " << line;
        const std::string& guid = columns[4];
        if (tag == "hobj") {
            // The partial form of an object URL is its page URL plus /o<n>.
            const std::string& url = columns[22];
            objectGuids[url.substr(0, url.rfind('/'))].insert(guid);
        } else {
            EXPECT_TRUE(allGuids.insert(guid).second) << "GUID " << guid << " carried by two records";
            if (tag == "hpage")
                guidOfPage[columns[22]] = guid;
        }
    }

    EXPECT_EQ(HTTP_THREADS * TABLES_PER_THREAD, perTag["hpage"]);
    EXPECT_EQ(HTTP_THREADS * TABLES_PER_THREAD * OBJECTS_PER_PAGE, perTag["hobj"]);
    EXPECT_EQ(2 * TABLES_PER_THREAD, perTag["video"]);
    EXPECT_EQ(2 * TABLES_PER_THREAD, perTag["audio"]);
    ASSERT_EQ(guidOfPage.size(), objectGuids.size());
    for (const auto& page : objectGuids) {
        ASSERT_EQ(1u, page.second.size()) << "objects of " << page.first << " carry several GUIDs";
        EXPECT_EQ(guidOfPage[page.first], *page.second.begin()) << "objects of " << page.first;
    }
}

TEST(ConcurrentRecords, SharedSamplerKeepsItsExactCount)
{
    // At 50 % every second record offered passes, whichever thread offers
    // it: 4 threads x 1000 offers give exactly 2000 passes.
    SampleControl sampler(50, 2, true);
    std::vector<int> passed(4, 0);
    std::vector<std::thread> threads;
    for (int t = 0; t < 4; ++t) {
        threads.emplace_back([&sampler, &passed, t] {
            for (int i = 0; i < 1000; ++i) {
                if (sampler.checkSampling())
                    ++passed[t];
                sampler.logSamplesActive();
            }
        });
    }
    for (std::thread& t : threads)
        t.join();
    int total = 0;
    for (int n : passed)
        total += n;
    EXPECT_EQ(2000, total);
    EXPECT_EQ(0, Access::count(sampler));
    EXPECT_FALSE(sampler.logSamplesActive());
}

TEST(ConcurrentRecords, SampledVideoTablesOnSeveralThreads)
{
    // 60 %: of every three entries offered to the video sampler two pass;
    // 3 threads x 100 tables x 4 entries = 1200 offers give 800 records.
    HandlerFixture fixture(Settings{{"WQ5_LOG_SAMPLE_PERCENTAGE", "60"}});
    DataHandler& handler = fixture.handler();
    std::vector<std::thread> threads;
    for (int t = 0; t < 3; ++t) {
        threads.emplace_back([&handler] {
            for (int k = 0; k < 100; ++k) {
                TableBuilder b(4);
                makeMediaTable(b, "QTIM");
                handler.processVideo(b.table());
            }
        });
    }
    for (std::thread& t : threads)
        t.join();
    const std::vector<std::string> all = wq5test::lines(fixture.log());
    EXPECT_EQ(800u, all.size());
    for (const std::string& line : all)
        ASSERT_EQ("video", wholeTag(line)) << line;
}

}  // namespace

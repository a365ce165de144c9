// Tables processed on several threads at once: every record reaches the log
// whole, none is lost, objects keep their page's GUID and sampling decision,
// and a sampler shared by threads keeps its exact count.
#include <gtest/gtest.h>

#include <atomic>
#include <map>
#include <set>
#include <sstream>
#include <string>
#include <thread>
#include <vector>

#include "support/handler_fixture.h"
#include "support/table_builder.h"

namespace {

using namespace wq5test;

const int HTTP_THREADS = 3, TABLES = 150, OBJECTS = 3;

// Thread t sends TABLES tables of a page http://s<t>/p<k> and its objects
// http://s<t>/p<k>/o<i>, or (the last two threads) of two video or audio entries.
void sendTables(DataHandler& handler, int t)
{
    const char* code = t < HTTP_THREADS ? "HTTP" : t == HTTP_THREADS ? "MSVD" : "MSAU";
    const auto process = t < HTTP_THREADS ? &DataHandler::processHttp
                                          : t == HTTP_THREADS ? &DataHandler::processVideo : &DataHandler::processAudio;
    for (int k = 0; k < TABLES; ++k) {
        TableBuilder b(t < HTTP_THREADS ? 1 + OBJECTS : 2);
        for (int i = 0; i < b.count(); ++i) {
            const std::string page = "http://s" + std::to_string(t) + "/p" + std::to_string(k);
            setType(b.entry(i), code);
            b.entry(i).detail.view.http.httpEntryType = i == 0 ? 1 : 2;
            b.setText(i, b.entry(i).detail.url, i == 0 ? page : page + "/o" + std::to_string(i));
        }
        (handler.*process)(b.table());
    }
}

TEST(ConcurrentRecords, EveryRecordWholeNoneLostObjectsWithTheirPage)
{
    // At 50 % exactly every second page and media entry offered passes, whichever thread offers it.
    HandlerFixture fixture({{"WQ5_LOG_HTTP", "Y"}, {"WQ5_LOG_HTTPOBJ", "Y"}, {"WQ5_LOG_SAMPLE_PERCENTAGE", "50"}});
    std::vector<std::thread> threads;
    for (int t = 0; t < HTTP_THREADS + 2; ++t)
        threads.emplace_back(sendTables, std::ref(fixture.handler()), t);
    for (std::thread& t : threads)
        t.join();

    std::map<std::string, int> perTag;
    std::map<std::string, std::string> pageGuid;                    // page URL -> GUID of its record
    std::map<std::string, std::multiset<std::string>> objectGuids;  // page URL -> GUIDs of its objects
    std::set<std::string> ownGuids;                                  // of pages and media records
    for (const std::string& line : lines(fixture.log())) {
        const std::string tag = line.substr(1, line.find('>') - 1), footer = "</" + tag + ">\n";
        ASSERT_TRUE(line[0] == '<' && line.size() > 2 * footer.size() &&
                    line.compare(line.size() - footer.size(), footer.size(), footer) == 0) << "not whole: " << line;
        std::vector<std::string> columns;
        std::istringstream body(line.substr(tag.size() + 2, line.size() - tag.size() - 2 - footer.size()));
        for (std::string column; std::getline(body, column, '^');)
            columns.push_back(column);
        ASSERT_EQ(tag[0] == 'h' ? 46u : 31u, columns.size()) << line;
        ++perTag[tag];
        const std::string &guid = columns[4], &url = columns[22];
        if (tag == "hobj")
            objectGuids[url.substr(0, url.rfind('/'))].insert(guid);
        else
            EXPECT_TRUE(ownGuids.insert(guid).second) << "GUID " << guid << " carried by two records";
        if (tag == "hpage")
            pageGuid[url] = guid;
    }
    const int pages = HTTP_THREADS * TABLES / 2;
    EXPECT_EQ((std::map<std::string, int>{{"audio", TABLES}, {"hobj", pages * OBJECTS}, {"hpage", pages},
                                          {"video", TABLES}}),
              perTag);
    EXPECT_EQ(pageGuid.size(), objectGuids.size()) << "objects without their page, or pages without their objects";
    for (const auto& page : objectGuids)
        EXPECT_EQ(size_t(OBJECTS), page.second.count(pageGuid[page.first])) << "objects of " << page.first;
}

TEST(ConcurrentRecords, SharedSamplerKeepsItsExactCount)
{
    SampleControl sampler(50, 2, true);
    std::atomic<int> passed{0};
    std::vector<std::thread> threads(4);
    for (std::thread& t : threads)
        t = std::thread([&] {
            for (int i = 0; i < 1000; ++i) {
                passed += sampler.checkSampling();
                (void)sampler.logSamplesActive();  // read while other threads decide
            }
        });
    for (std::thread& t : threads)
        t.join();
    EXPECT_EQ(2000, passed.load());
}

}  // namespace

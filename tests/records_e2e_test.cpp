// The real collector replaying table scripts through the simulated
// collection library: the log holds exactly the expected records, in script
// order with one library thread, in some order with several.
#include <gtest/gtest.h>

#include <algorithm>
#include <csignal>
#include <map>
#include <set>
#include <string>
#include <vector>

#include <sys/stat.h>

#include "support/handler_fixture.h"

namespace {

using namespace wq5test;

// `record` with its GUID replaced by "*" and the GUID's last `keep`
// characters (the last 15 are its counter and the collector name); the
// process id, time and random parts differ from run to run.
std::string maskGuid(const std::string& record, size_t keep, std::string* guid)
{
    const size_t start = record.find("^wq5coll^") + 9, end = std::min(record.find('^', start), record.size());
    *guid = record.substr(start, end - start);
    const size_t hex = guid->find_first_not_of("0123456789abcdef");
    EXPECT_TRUE(hex >= 18 && hex != std::string::npos && guid->substr(hex) == "wq5coll") << *guid << " in " << record;
    return record.substr(0, start) + "*" + guid->substr(guid->size() - std::min(keep, guid->size())) +
           record.substr(end);
}

class RecordsEndToEnd : public ::testing::Test {
protected:
    void SetUp() override { ASSERT_EQ(0, mkdir((m_dir + "/log").c_str(), 0755)); }
    void TearDown() override { removeTree(m_dir); }

    // What the collector logs from `script`, every switch on, stopped once every table is back.
    std::vector<std::string> run(const std::string& script, int threads)
    {
        const std::string status = m_dir + "/status.json";
        std::map<std::string, std::string> env = {
            {"MOQ_TRACE", "error"}, {"MOQ_TRACE_FILE", m_dir + "/trace.log"}, {"WQ5_COLLECTOR_ID", "wq5coll"},
            {"WQ5_LOG_DIR", m_dir + "/log"}, {"ZUB1_REPLAY", script}, {"ZUB1_STATUS_FILE", status},
            {"ZUB1_THREADS", std::to_string(threads)}};
        for (const char* name : {"WQ5_WORK_PATH", "WQ5_LOG_SAMPLE_PERCENTAGE", "WQ5_LOG_MAX_SIZE_MB", "WQ5_SUB_CHAR",
                                 "WQ5_FIELD_DELIMITER", "ZUB1_START_DELAY_MS", "ZUB1_REGISTER_FAILURES"})
            env[name] = "\x01unset";
        for (const char* k :
             {"HTTP", "HTTPOBJ", "HTTPS", "MS_VIDEO", "MS_AUDIO", "REAL_VIDEO", "REAL_AUDIO", "QUICKTIME"})
            env[std::string("WQ5_LOG_") + k] = "Y";
        Collector collector(collectorBinary(), env);
        EXPECT_TRUE(collector.started());
        EXPECT_TRUE(waitFor(m_dir, [&] { return access(status.c_str(), F_OK) == 0; }))
            << "the library never became idle\n" << readFile(m_dir + "/trace.log");
        collector.signal(SIGTERM);
        const int exit = collector.wait();
        EXPECT_TRUE(exit != -1 && WIFEXITED(exit) && WEXITSTATUS(exit) == 0) << "wait status " << exit;
        const std::string counts = readFile(status);
        EXPECT_TRUE(counts.find("\"invalid\":0") != std::string::npos &&
                    counts.find("\"unmatched\":0") != std::string::npos) << counts;
        return lines(readLogDir(m_dir + "/log"));
    }

    const std::string m_dir = makeTempDir();
};

TEST_F(RecordsEndToEnd, OneLibraryThreadWritesTheExpectedRecordsInOrder)
{
    const std::string data = std::string(WQ5_SOURCE_DIR) + "/tests/data/";
    std::string masked, guid;
    for (const std::string& record : run(data + "records_single.jsonl", 1))
        masked += maskGuid(record, 15, &guid);
    EXPECT_EQ(readFile(data + "records_single.expected"), masked);
}

TEST_F(RecordsEndToEnd, SeveralLibraryThreadsWriteTheSameRecordsInSomeOrder)
{
    // Per k: a page of site k with two objects, then a video and an audio table.
    const int TABLES = 60;
    const std::string ints = "0^0^0^0^0^0^0^0^0^0^0^0^";
    std::string script;
    std::vector<std::string> expected;
    for (int k = 0; k < TABLES; ++k) {
        const std::string n = std::to_string(k), site = "http://site" + n;
        const std::string head = "v121^92^0^wq5coll^*^0^^^0^^^0^^0^0^0^0^0^0^0^0^0^";
        script += "{\"filter\":[0,80],\"entries\":[{\"rdType\":\"HTTP\",\"httpEntryType\":1,\"url\":\"" + site +
                  "/index.html\",\"title\":\"Home " + n + "\"}";
        expected.push_back("<hpage>" + head + site + "/index.html^N/A^N/A^N/A^N/A^" + ints + "site" + n +
                           "^/index.html^index.html^N/A^N/A^Home " + n + "^0</hpage>\n");
        for (const std::string object : {"1", "2"}) {
            script += ",{\"rdType\":\"HTTP\",\"httpEntryType\":2,\"url\":\"" + site + "/img/" + object + ".png\"}";
            expected.push_back("<hobj>" + head + site + "/img/" + object + ".png^N/A^N/A^N/A^N/A^" + ints + "site" +
                               n + "^/img/" + object + ".png^" + object + ".png^N/A^N/A^N/A^0</hobj>\n");
        }
        script += "]}\n{\"filter\":[1,0],\"entries\":[{\"rdType\":\"MSVD\",\"mediaInt0\":" + n +
                  "}]}\n{\"filter\":[6,0],\"entries\":[{\"rdType\":\"RLAU\",\"mediaInt0\":" + n + "}]}\n";
        expected.push_back("<video>" + head + "5^N/A^N/A^N/A^N/A^N/A^" + n + "^0^0</video>\n");
        expected.push_back("<audio>" + head + "10^N/A^N/A^N/A^N/A^N/A^" + n + "^0^0</audio>\n");
    }
    writeFile(m_dir + "/script.jsonl", script);

    std::vector<std::string> actual;
    std::map<std::string, std::set<std::string>> siteGuids;  // the GUIDs of each site's page and objects
    std::set<std::string> distinct;
    for (const std::string& record : run(m_dir + "/script.jsonl", 4)) {
        std::string guid;
        actual.push_back(maskGuid(record, 0, &guid));
        distinct.insert(guid);
        const size_t site = record.find("http://site");
        if (site != std::string::npos)
            siteGuids[record.substr(site, record.find('/', site + 7) - site)].insert(guid);
    }
    std::sort(actual.begin(), actual.end());
    std::sort(expected.begin(), expected.end());
    EXPECT_EQ(expected, actual);
    for (const auto& site : siteGuids)
        EXPECT_EQ(1u, site.second.size()) << "the objects of " << site.first << " carry another GUID than their page";
    EXPECT_EQ(size_t(3 * TABLES), distinct.size()) << "every page and media record has a GUID of its own";
}

}  // namespace

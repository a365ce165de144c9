// The real collector replaying table scripts through the simulated
// collection library: the log holds exactly the expected records, with one
// library thread in script order, with several in some order.
#include <gtest/gtest.h>

#include <algorithm>
#include <csignal>
#include <map>
#include <set>
#include <string>
#include <vector>

#include <sys/stat.h>

#include "support/handler_fixture.h"
#include "support/process.h"

namespace {

using namespace wq5test;

const char HEX[] = "0123456789abcdef";

// Replaces the GUID column (the fifth) of every record by "*" and its last
// 15 characters (the counter and the collector name): the process id, time
// and random parts differ from run to run. Reports a GUID of another shape.
std::string maskGuids(const std::string& log, std::vector<std::string>* guids = nullptr)
{
    std::string out;
    for (const std::string& line : lines(log)) {
        std::string::size_type start = 0;
        for (int column = 0; column < 4 && start != std::string::npos; ++column)
            start = line.find('^', start + 1);
        const std::string::size_type end = start == std::string::npos ? start : line.find('^', start + 1);
        if (end == std::string::npos) {
            ADD_FAILURE() << "record without GUID column: " << line;
            out += line;
            continue;
        }
        const std::string guid = line.substr(start + 1, end - start - 1);
        const std::string suffix = "wq5coll";
        const bool shaped = guid.size() > 8 + suffix.size() &&
                            guid.compare(guid.size() - suffix.size(), suffix.size(), suffix) == 0 &&
                            guid.find_first_not_of(HEX) == guid.size() - suffix.size();
        EXPECT_TRUE(shaped) << "GUID <" << guid << "> in " << line;
        if (guids != nullptr)
            guids->push_back(guid);
        out += line.substr(0, start + 1) + "*" + guid.substr(guid.size() < 15 ? 0 : guid.size() - 15) +
               line.substr(end);
    }
    return out;
}

class RecordsEndToEnd : public ::testing::Test {
protected:
    void SetUp() override
    {
        m_dir = makeTempDir();
        ASSERT_FALSE(m_dir.empty());
        ASSERT_EQ(0, mkdir((m_dir + "/log").c_str(), 0755));
    }
    void TearDown() override { removeTree(m_dir); }

    // Runs the collector over `script` with every switch on and returns
    // what it logged; stops it with SIGTERM once the library has delivered
    // and got back every table.
    std::string run(const std::string& script, int threads)
    {
        const std::string status = m_dir + "/status.json";
        std::map<std::string, std::string> env = {
            {"MOQ_TRACE", "error"},
            {"MOQ_TRACE_FILE", m_dir + "/trace.log"},
            {"WQ5_WORK_PATH", "\x01unset"},
            {"WQ5_COLLECTOR_ID", "wq5coll"},
            {"WQ5_LOG_DIR", m_dir + "/log"},
            {"WQ5_LOG_SAMPLE_PERCENTAGE", "\x01unset"},
            {"WQ5_LOG_MAX_SIZE_MB", "\x01unset"},
            {"WQ5_FIELD_DELIMITER", "\x01unset"},
            {"WQ5_SUB_CHAR", "\x01unset"},
            {"ZUB1_REPLAY", script},
            {"ZUB1_STATUS_FILE", status},
            {"ZUB1_THREADS", std::to_string(threads)},
            {"ZUB1_START_DELAY_MS", "\x01unset"},
            {"ZUB1_REGISTER_FAILURES", "\x01unset"},
        };
        for (const char* name : {"WQ5_LOG_HTTP", "WQ5_LOG_HTTPOBJ", "WQ5_LOG_HTTPS", "WQ5_LOG_MS_VIDEO",
                                 "WQ5_LOG_MS_AUDIO", "WQ5_LOG_REAL_VIDEO", "WQ5_LOG_REAL_AUDIO", "WQ5_LOG_QUICKTIME"})
            env[name] = "Y";

        Collector collector(collectorBinary(), env);
        EXPECT_TRUE(collector.started());
        EXPECT_TRUE(waitFor(m_dir, [&] { return access(status.c_str(), F_OK) == 0; }))
            << "the library never became idle\n"
            << readFile(m_dir + "/trace.log");
        collector.signal(SIGTERM);
        const int exit = collector.wait();
        EXPECT_NE(-1, exit) << "collector did not stop";
        EXPECT_TRUE(WIFEXITED(exit) && WEXITSTATUS(exit) == 0) << "wait status " << exit;

        const std::string counts = readFile(status);
        EXPECT_NE(std::string::npos, counts.find("\"invalid\":0")) << counts;
        EXPECT_NE(std::string::npos, counts.find("\"unmatched\":0")) << counts;

        return readLogDir();
    }

    std::string readLogDir() const
    {
        std::vector<std::string> names;
        if (DIR* dir = opendir((m_dir + "/log").c_str())) {
            while (struct dirent* e = readdir(dir))
                if (e->d_name[0] != '.')
                    names.push_back(e->d_name);
            closedir(dir);
        }
        std::sort(names.begin(), names.end());
        std::string all;
        for (const std::string& name : names)
            all += readFile(m_dir + "/log/" + name);
        return all;
    }

    std::string m_dir;
};

TEST_F(RecordsEndToEnd, OneLibraryThreadWritesTheExpectedRecordsInOrder)
{
    const std::string data = std::string(WQ5_SOURCE_DIR) + "/tests/data/";
    const std::string log = run(data + "records_single.jsonl", 1);
    EXPECT_EQ(readFile(data + "records_single.expected"), maskGuids(log));
}

// The records of table `k` of the generated script: a page and two
// objects on site k, and a video and an audio entry.
std::string httpLine(int k)
{
    const std::string site = "http://site" + std::to_string(k);
    return "{\"filter\":[0,80],\"entries\":[{\"rdType\":\"HTTP\",\"httpEntryType\":1,\"url\":\"" + site +
           "/index.html\",\"title\":\"Home " + std::to_string(k) +
           "\"},{\"rdType\":\"HTTP\",\"httpEntryType\":2,\"url\":\"" + site +
           "/img/1.png\"},{\"rdType\":\"HTTP\",\"httpEntryType\":2,\"url\":\"" + site + "/img/2.png\"}]}\n";
}

std::string mediaLine(int k)
{
    return "{\"filter\":[1,0],\"entries\":[{\"rdType\":\"MSVD\",\"mediaInt0\":" + std::to_string(k) +
           "}]}\n{\"filter\":[6,0],\"entries\":[{\"rdType\":\"RLAU\",\"mediaInt0\":" + std::to_string(k) + "}]}\n";
}

const std::string ZERO_COMMON = "0^^^0^^^0^^0^0^0^0^0^0^0^0^0^";
const std::string ZERO_INTS = "0^0^0^0^0^0^0^0^0^0^0^0^";

std::vector<std::string> expectedRecords(int k)
{
    const std::string n = std::to_string(k);
    const std::string site = "site" + n;
    const std::string head = "v121^92^0^wq5coll^*^" + ZERO_COMMON;
    return {
        "<hpage>" + head + "http://" + site + "/index.html^N/A^N/A^N/A^N/A^" + ZERO_INTS + site +
            "^/index.html^index.html^N/A^N/A^Home " + n + "^0</hpage>\n",
        "<hobj>" + head + "http://" + site + "/img/1.png^N/A^N/A^N/A^N/A^" + ZERO_INTS + site +
            "^/img/1.png^1.png^N/A^N/A^N/A^0</hobj>\n",
        "<hobj>" + head + "http://" + site + "/img/2.png^N/A^N/A^N/A^N/A^" + ZERO_INTS + site +
            "^/img/2.png^2.png^N/A^N/A^N/A^0</hobj>\n",
        "<video>" + head + "5^N/A^N/A^N/A^N/A^N/A^" + n + "^0^0</video>\n",
        "<audio>" + head + "10^N/A^N/A^N/A^N/A^N/A^" + n + "^0^0</audio>\n",
    };
}

TEST_F(RecordsEndToEnd, SeveralLibraryThreadsWriteTheSameRecordsInSomeOrder)
{
    const int TABLES = 60;
    std::string script;
    std::vector<std::string> expected;
    for (int k = 0; k < TABLES; ++k) {
        script += httpLine(k) + mediaLine(k);
        for (const std::string& record : expectedRecords(k))
            expected.push_back(record);
    }
    writeFile(m_dir + "/script.jsonl", script);

    std::vector<std::string> guids;
    const std::string log = run(m_dir + "/script.jsonl", 4);
    const std::vector<std::string> records = lines(log);
    maskGuids(log, &guids);
    ASSERT_EQ(records.size(), guids.size());

    // Same records, GUIDs aside: every GUID column masked to "*".
    std::vector<std::string> actual;
    for (size_t i = 0; i < records.size(); ++i) {
        std::string masked = records[i];
        masked.replace(masked.find(guids[i]), guids[i].size(), "*");
        actual.push_back(masked);
    }
    std::sort(actual.begin(), actual.end());
    std::sort(expected.begin(), expected.end());
    EXPECT_EQ(expected, actual);

    // Every object carries its page's GUID; pages and media records each
    // have their own.
    std::map<std::string, std::string> pageGuid;
    std::set<std::string> own;
    for (size_t i = 0; i < records.size(); ++i) {
        const std::string& r = records[i];
        if (r.compare(0, 7, "<hpage>") == 0)
            pageGuid[r.substr(r.find("http://"), r.find("/index.html") - r.find("http://"))] = guids[i];
        if (r.compare(0, 6, "<hobj>") != 0) {
            EXPECT_TRUE(own.insert(guids[i]).second) << "GUID shared: " << r;
        }
    }
    for (size_t i = 0; i < records.size(); ++i) {
        const std::string& r = records[i];
        if (r.compare(0, 6, "<hobj>") != 0)
            continue;
        const std::string site = r.substr(r.find("http://"), r.find("/img/") - r.find("http://"));
        EXPECT_EQ(pageGuid[site], guids[i]) << r;
    }
}

}  // namespace

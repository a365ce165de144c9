// Several threads write records through DataWriterLock while a tiny size
// limit makes the writer roll over again and again: every record lands
// whole, exactly once, in some file.
#include "src/mdwriter.h"

#include <gtest/gtest.h>

#include <filesystem>
#include <set>
#include <sstream>
#include <string>
#include <thread>
#include <vector>

#include "support/process.h"

namespace {

const int THREADS = 4, RECORDS = 400, LIMIT_BYTES = 256;

// Padded by n % 97 characters, so that records straddle the limit at every offset.
std::string makeRecord(int thread, int n)
{
    return "<rec t=" + std::to_string(thread) + " n=" + std::to_string(n) + " pad=" +
           std::string(n % 97, static_cast<char>('a' + thread)) + ">";
}

TEST(DataWriterConcurrency, EveryRecordWholeAndExactlyOnceAcrossRollovers)
{
    const std::string dir = wq5test::makeTempDir();
    {
        DataWriter writer(dir, "wq5", 7, 0);
        writer.setMaxSizeBytes(LIMIT_BYTES);
        std::vector<int> dropped(THREADS, 0);
        std::vector<std::thread> threads;
        for (int t = 0; t < THREADS; ++t)
            threads.emplace_back([&writer, &dropped, t] {
                for (int n = 0; n < RECORDS; ++n) {
                    const std::string record = makeRecord(t, n) + "\n";
                    DataWriterLock lock(writer);
                    FILE* stream = lock.getStream();
                    dropped[t] += stream == nullptr || fwrite(record.data(), record.size(), 1, stream) != 1;
                }
            });
        for (std::thread& t : threads)
            t.join();
        EXPECT_EQ(std::vector<int>(THREADS, 0), dropped) << "records dropped per thread";
    }

    std::set<std::string> expected;
    for (int t = 0; t < THREADS; ++t)
        for (int n = 0; n < RECORDS; ++n)
            expected.insert(makeRecord(t, n));
    int files = 0;
    for (const auto& entry : std::filesystem::directory_iterator(dir)) {
        ++files;
        const std::string text = wq5test::readFile(entry.path());
        EXPECT_LE(text.size(), LIMIT_BYTES + makeRecord(0, 96).size() + 8) << entry.path() << ": beyond one record";
        EXPECT_TRUE(text.empty() || text.back() == '\n') << entry.path() << " ends inside a record";
        std::istringstream lines(text);
        for (std::string line; std::getline(lines, line);)
            EXPECT_EQ(1u, expected.erase(line)) << "<" << line << "> is no record, or written twice";
    }
    EXPECT_GT(files, 200) << "the limit should have rolled the file hundreds of times";
    EXPECT_TRUE(expected.empty()) << expected.size() << " records lost, one is <" << *expected.begin() << ">";
    wq5test::removeTree(dir);
}

}  // namespace

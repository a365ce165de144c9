// Several threads write records through DataWriterLock while a tiny size
// limit makes the writer roll over again and again: every record must land
// whole, exactly once, in some file.
#include "src/mdwriter.h"

#include <gtest/gtest.h>

#include <cerrno>
#include <cstdlib>
#include <cstring>
#include <filesystem>
#include <fstream>
#include <map>
#include <sstream>
#include <string>
#include <thread>
#include <vector>

namespace fs = std::filesystem;

namespace {

const int THREADS = 4;
const int RECORDS_PER_THREAD = 400;
const int64_t LIMIT_BYTES = 2048;

// "<rec t=T n=N pad=PPP...>\n", the padding length varying with n so that
// records straddle the limit at every offset.
std::string makeRecord(int thread, int n)
{
    std::string record = "<rec t=" + std::to_string(thread) + " n=" + std::to_string(n) + " pad=";
    record.append(static_cast<size_t>(n % 97), static_cast<char>('a' + thread));
    return record + ">\n";
}

TEST(DataWriterConcurrency, EveryRecordWholeAndExactlyOnceAcrossRollovers)
{
    std::string templ = (fs::temp_directory_path() / "mdwriter_conc_XXXXXX").string();
    std::vector<char> buf(templ.begin(), templ.end());
    buf.push_back('\0');
    ASSERT_NE(mkdtemp(buf.data()), nullptr) << strerror(errno);
    const std::string dir = buf.data();

    {
        DataWriter writer(dir, "wq5", 7, 0);
        writer.setMaxSizeBytes(LIMIT_BYTES);

        std::vector<std::thread> threads;
        std::vector<int> dropped(THREADS, 0);
        for (int t = 0; t < THREADS; ++t) {
            threads.emplace_back([&writer, &dropped, t] {
                for (int n = 0; n < RECORDS_PER_THREAD; ++n) {
                    const std::string record = makeRecord(t, n);
                    DataWriterLock lock(writer);
                    FILE* stream = lock.getStream();
                    if (stream == nullptr || fwrite(record.data(), record.size(), 1, stream) != 1)
                        ++dropped[t];
                }
            });
        }
        for (std::thread& th : threads)
            th.join();
        for (int t = 0; t < THREADS; ++t)
            EXPECT_EQ(dropped[t], 0) << "thread " << t;
    }

    std::map<std::string, int> seen;
    int files = 0;
    for (const fs::directory_entry& e : fs::directory_iterator(dir)) {
        ++files;
        std::ifstream in(e.path(), std::ios::binary);
        std::stringstream content;
        content << in.rdbuf();
        const std::string text = content.str();
        // A file exceeds the limit by at most the one record that passed it.
        EXPECT_LE(static_cast<int64_t>(text.size()), LIMIT_BYTES + static_cast<int64_t>(makeRecord(0, 96).size()))
            << e.path();
        ASSERT_TRUE(text.empty() || text.back() == '\n') << e.path() << " ends inside a record";
        std::istringstream lines(text);
        std::string line;
        while (std::getline(lines, line))
            ++seen[line + "\n"];
    }
    EXPECT_GT(files, 10) << "the limit should have rolled the file many times";

    for (int t = 0; t < THREADS; ++t)
        for (int n = 0; n < RECORDS_PER_THREAD; ++n) {
            const std::string record = makeRecord(t, n);
            auto it = seen.find(record);
            EXPECT_TRUE(it != seen.end() && it->second == 1)
                << "record t=" << t << " n=" << n << " seen " << (it == seen.end() ? 0 : it->second) << " times";
            if (it != seen.end())
                seen.erase(it);
        }
    for (const auto& rest : seen)
        ADD_FAILURE() << "unexpected or broken line: " << rest.first;

    std::error_code ec;
    fs::remove_all(dir, ec);
}

}  // namespace

// The log checker on directories made by hand: whole records in files named
// in order pass; every kind of fault is counted where it is, and the command
// says so in its exit status.
#include <gtest/gtest.h>

#include <array>
#include <map>
#include <string>

#include <sys/stat.h>

#include "support/process.h"
#include "support/wq5check_run.h"
#include "wq5check_lib.h"

namespace {

using namespace wq5test;

// A whole record of `tag` whose URL query holds `query`: the query column of
// an HTTP record, the URL column of a media record.
std::string record(const std::string& tag, const std::string& query, char delimiter = '^')
{
    const bool http = tag == "hpage" || tag == "hobj";
    std::string line = "<" + tag + ">";
    for (int column = 0; column < (http ? 46 : 31); ++column) {
        const std::string text = column == 42 && http    ? query
                                 : column == 23 && !http ? "mms://m.example/a.wmv?" + query
                                                         : "c" + std::to_string(column);
        line += (column > 0 ? std::string(1, delimiter) : "") + text;
    }
    return line + "</" + tag + ">\n";
}
std::string rec(const std::string& tag, int seq) { return record(tag, "a=b&seq=" + std::to_string(seq)); }
// The record `line` under another tag, both ends.
std::string retag(const std::string& line, const std::string& tag)
{
    const size_t open = line.find('>') + 1, close = line.rfind("</");
    return "<" + tag + ">" + line.substr(open, close - open) + "</" + tag + ">\n";
}

struct Row {
    const char* what;
    std::map<std::string, std::string> files;
    std::array<long, 6> counts;  // torn, unnumbered, duplicates, gaps, misnamed, whole records
    char delimiter = '^';
};
const std::string TORN_HOBJ = rec("hobj", 1).substr(0, 100);
const Row ROWS[] = {
    {"whole records in two files", {{"20240305.wq5", rec("hpage", 0) + rec("hobj", 1)},
                                    {"20240305.1.wq5", rec("video", 2) + rec("audio", 3)}}, {0, 0, 0, 0, 0, 4}},
    {"other names passed over", {{"20240305.wq5", rec("hpage", 0)}, {"20240305.wq5.bak", "x"}, {"notes", "x"},
                                 {"20240305.0.wq5", "x"}, {"20240305.01.wq5", "x"}, {"2024030.wq5", "x"},
                                 {"2024030x.wq5", "x"}, {"20240305.1x.wq5", "x"}, {"20240305..wq5", "x"}},
     {0, 0, 0, 0, 0, 1}},
    {"a new day starts unnumbered", {{"20240305.wq5", rec("hpage", 0)}, {"20240305.1.wq5", rec("hobj", 1)},
                                     {"20240306.wq5", rec("video", 2)}}, {0, 0, 0, 0, 0, 3}},
    {"tags that differ", {{"20240305.wq5", rec("hpage", 0) + "<hpage>" + rec("hobj", 1).substr(6) + rec("video", 2)}},
     {1, 0, 0, 1, 0, 2}},
    {"unknown tag", {{"20240305.wq5", "<hsum>x</hsum>\n" + rec("hpage", 0)}}, {1, 0, 0, 0, 0, 1}},
    {"one column", {{"20240305.wq5", record("hpage", "seq=0").substr(0, 9) + "</hpage>\n"}}, {1, 0, 0, 0, 0, 0}},
    {"media columns under an HTTP tag", {{"20240305.wq5", retag(rec("video", 0), "hobj")}}, {1, 0, 0, 0, 0, 0}},
    {"HTTP columns under a media tag", {{"20240305.wq5", retag(rec("hpage", 0), "audio")}}, {1, 0, 0, 0, 0, 0}},
    {"two records torn into each other", {{"20240305.wq5", rec("hpage", 0) + TORN_HOBJ + rec("video", 2) +
                                                                rec("hobj", 1).substr(100) + rec("audio", 3)}},
     {2, 0, 0, 2, 0, 2}},
    {"the file ends inside a record", {{"20240305.wq5", rec("hpage", 0) + TORN_HOBJ}}, {1, 0, 0, 0, 0, 1}},
    {"the newline of the last record missing", {{"20240305.wq5", rec("audio", 0).substr(0, rec("audio", 0).size() - 1)}},
     {1, 0, 0, 0, 0, 0}},
    {"a record twice", {{"20240305.wq5", rec("hpage", 0) + rec("hobj", 1)}, {"20240305.1.wq5", rec("hobj", 1)}},
     {0, 0, 1, 0, 0, 3}},
    {"numbers missing", {{"20240305.wq5", rec("video", 3) + rec("audio", 1)}}, {0, 0, 0, 2, 0, 2}},
    {"no number in the query", {{"20240305.wq5", record("hpage", "seq=x") + record("video", "page=1")}},
     {0, 2, 0, 0, 0, 2}},
    {"a file number missing", {{"20240305.wq5", rec("hpage", 0)}, {"20240305.2.wq5", rec("hobj", 1)}},
     {0, 0, 0, 0, 1, 2}},
    {"no unnumbered file", {{"20240305.1.wq5", rec("hpage", 0)}}, {0, 0, 0, 0, 1, 1}},
    {"another delimiter", {{"20240305.wq5", record("hpage", "seq=0", '|') + record("audio", "seq=1", '|')}},
     {0, 0, 0, 0, 0, 2}, '|'},
    {"another delimiter not asked for", {{"20240305.wq5", record("hpage", "seq=0", '|')}}, {1, 0, 0, 0, 0, 0}},
};

TEST(Wq5Check, CountsEveryKindOfFaultWhereItIs)
{
    for (const Row& row : ROWS) {
        SCOPED_TRACE(row.what);
        const std::string dir = makeTempDir();
        for (const auto& file : row.files)
            writeFile(dir + "/" + file.first, file.second);
        const wq5check::Report report = wq5check::checkDirectory(dir, {row.delimiter, "seq"});
        EXPECT_EQ((std::array<long, 6>{report.torn, report.unnumbered, report.duplicates, report.gaps, report.misnamed,
                                       report.total()}),
                  row.counts) << wq5check::summary(report);
        EXPECT_EQ(report.clean(), row.counts[0] + row.counts[1] + row.counts[2] + row.counts[3] + row.counts[4] == 0);
        removeTree(dir);
    }
}

TEST(Wq5Check, FilesInOrderOfDayAndNumberAndRecordsPerTag)
{
    const std::string dir = makeTempDir();
    const char* const names[] = {"20240305.10.wq5", "20240305.wq5", "20240306.wq5", "20240305.2.wq5"};
    for (int n = 0; n < 11; ++n)
        writeFile(dir + "/20240305" + (n > 0 ? "." + std::to_string(n) : "") + ".wq5", rec("hobj", n));
    writeFile(dir + "/20240306.wq5", rec("hpage", 11) + rec("video", 12));
    const wq5check::Report report = wq5check::checkDirectory(dir, {});
    ASSERT_EQ(report.files.size(), 12u);
    EXPECT_EQ(report.files[0], names[1]);
    EXPECT_EQ(report.files[2], names[3]);
    EXPECT_EQ(report.files[10], names[0]);
    EXPECT_EQ(report.files[11], names[2]);
    EXPECT_EQ(report.records, (std::map<std::string, long>{{"hobj", 11}, {"hpage", 1}, {"video", 1}}));
    EXPECT_EQ(report.highest, -1) << "no sequence asked for";
    EXPECT_TRUE(report.clean());
    removeTree(dir);
}

TEST(Wq5Check, TheCommandSaysCleanOnlyForAWholeLog)
{
    const std::string dir = makeTempDir(), out = dir + "/out.txt";
    writeFile(dir + "/20240305.wq5", rec("hpage", 0) + rec("hobj", 1));
    std::string output;
    EXPECT_EQ(runWq5check({"--seq-field", "seq", dir}, out, &output), 0) << output;
    EXPECT_NE(output.find("records: 2 (hobj 1, hpage 1)\nsequence: 0..1, 2 distinct\n"), std::string::npos) << output;
    EXPECT_EQ(runWq5check({"--delimiter", "|", dir}, out, &output), 1) << output;
    EXPECT_NE(output.find("20240305.wq5:1: 1 columns in <hpage>, not 46"), std::string::npos) << output;
    for (const std::vector<std::string>& wrong : {std::vector<std::string>{}, {"--delimiter", "ab", dir},
                                                  {"--seq-field"}, {dir, dir}, {"--verbose", dir}})
        EXPECT_TRUE(runWq5check(wrong, out, &output) == 2 && output.rfind("usage: wq5check", 0) == 0) << output;
    removeTree(dir);
}

}  // namespace

// Whole records byte for byte (HTTP pages and objects, video and audio), the
// table walk, texts at their bounds and GUIDs.
#include <gtest/gtest.h>

#include <cstdio>
#include <cstring>
#include <sstream>
#include <string>
#include <vector>

#include "support/handler_fixture.h"
#include "support/table_builder.h"
#include "support/trace_capture.h"

namespace {

using namespace wq5test;
typedef DataHandlerTestAccess Access;

const Settings HTTP_ON = {{"WQ5_LOG_HTTP", "Y"}, {"WQ5_LOG_HTTPOBJ", "Y"}};

// Entry `i` with the common part of COMMON, its type code and HTTP entry type.
ZUB_RESPONSE_TIME_DATA& makeEntry(TableBuilder& b, int i, const char* code, int httpType)
{
    ZUB_RESPONSE_TIME_DATA& e = b.entry(i);
    setField(e.stampText, "ABCD2024-03-05T12:34:56");
    setField(e.textA, "client-a");
    setField(e.textB, "srv-b");
    setField(e.textC, "proxy-c");
    e.ulongValue = 4000000000u;
    e.intValue = -7;
    e.ushortA = 65535;
    e.ushortB = 8080;
    const int32_t metrics[] = {1, 2, 3, 4, -5, 100, -200, 2147483647};  // intMetric1 to longMetric3, in a row
    memcpy(&e.intMetric1, metrics, sizeof(metrics));
    setType(e, code);
    if (httpType != 0)
        e.detail.view.http.httpEntryType = httpType;
    return e;
}
const std::string COMMON_TAIL = "^-7^client-a^srv-b^65535^proxy-c^8080^1^2^3^4^-5^100^-200^2147483647^";
const std::string COMMON = "4000000000^2024-03-05^12:34:56" + COMMON_TAIL;

// A page with every HTTP field set; httpInt<k> holds 10 + k, httpInt0 99.
void makePage(TableBuilder& b, int i)
{
    ZUB_RESPONSE_TIME_DATA& e = makeEntry(b, i, "HTTP", 1);
    ZUB_HTTP_DETAIL& h = e.detail.view.http;
    b.setText(i, e.detail.url, "http://www.example.com:8080/shop/cart.html?item=7#top");
    b.setText(i, e.detail.detailText1, "GET");
    b.setText(i, e.detail.detailText2, "200");
    b.setText(i, e.detail.detailText3, "text/html");
    b.setText(i, h.title, "Cart");
    setField(h.httpText, "keep-alive");
    h.httpInt0 = 99;
    int32_t* ints[] = {&h.httpInt1, &h.httpInt2, &h.httpInt3, &h.httpInt4,  &h.httpInt5,  &h.httpInt6,
                       &h.httpInt7, &h.httpInt8, &h.httpInt9, &h.httpInt10, &h.httpInt11, &h.httpInt12};
    for (int k = 1; k <= 12; ++k)
        *ints[k - 1] = 10 + k;
}
const std::string PAGE_TO_TITLE = "http://www.example.com:8080/shop/cart.html^GET^200^text/html^keep-alive^11^12^13^"
                                  "14^18^19^20^21^22^17^16^15^www.example.com^/shop/cart.html^cart.html^item=7^top^";

// An object http://h/<n> with httpInt0 n, its other fields empty.
void makeObject(TableBuilder& b, int i, int n)
{
    makeEntry(b, i, "HTTP", 2).detail.view.http.httpInt0 = n;
    b.setText(i, b.entry(i).detail.url, "http://h/" + std::to_string(n));
}

void makeMedia(TableBuilder& b, int i, const char* code, int int0, int int1 = 0, int int2 = 0)
{
    ZUB_MEDIA_DETAIL& m = makeEntry(b, i, code, 0).detail.view.media;
    m.mediaInt0 = int0;
    m.mediaInt1 = int1;
    m.mediaInt2 = int2;
}

// A record with the default delimiter.
std::string line(const std::string& tag, const std::string& guid, const std::string& columns,
                 const std::string& common = COMMON)
{
    return "<" + tag + ">v121^92^0^wq5coll^" + guid + "^" + common + columns + "</" + tag + ">\n";
}
std::string pageLine(const char* guid) { return line("hpage", guid, PAGE_TO_TITLE + "Cart^99"); }
std::string videoLine(const char* guid, const std::string& ints, const std::string& common = COMMON)
{
    return line("video", guid, "5^N/A^N/A^N/A^N/A^N/A^" + ints, common);
}
std::string objectLine(const std::string& n, const char* guid)
{
    return line("hobj", guid, "http://h/" + n + "^N/A^N/A^N/A^N/A^0^0^0^0^0^0^0^0^0^0^0^0^h^/" + n + "^" + n +
                                  "^N/A^N/A^N/A^" + n);
}

TEST(HttpRecords, PagesAndObjectsBySwitchAndSampling)
{
    // tables: P page, O object (numbered from 1 in order), | the next table;
    // records: P@g page record, On@g record of object n, with GUID g.
    const struct { const char* what; Settings settings; const char* tables, *records; int lastGuid; } rows[] = {
        {"both on: a page and its three objects share its GUID", HTTP_ON, "POOO", "P@0 O1@0 O2@0 O3@0", 0},
        {"page switch off: objects carry the unwritten page's GUID, the next page moves it on",
         {{"WQ5_LOG_HTTP", "N"}, {"WQ5_LOG_HTTPOBJ", "Y"}}, "POOO|PO", "O1@0 O2@0 O3@0 O4@1", 1},
        {"only secure HTTP on: nothing written, every page makes a GUID", {{"WQ5_LOG_HTTPS", "Y"}}, "POP", "", 1},
        {"objects before any page share the GUID the first one made", HTTP_ON, "OO|O", "O1@0 O2@0 O3@0", 0},
        {"50 %: objects follow their page; one heading a table follows the latest page",
         {{"WQ5_LOG_HTTP", "Y"}, {"WQ5_LOG_HTTPOBJ", "Y"}, {"WQ5_LOG_SAMPLE_PERCENTAGE", "50"}}, "POPO|OPO",
         "P@0 O1@0 P@2 O4@2", 2},
    };
    for (const auto& r : rows) {
        HandlerFixture fixture(r.settings);
        std::istringstream tables(r.tables);
        int object = 0;
        for (std::string table; std::getline(tables, table, '|');) {
            TableBuilder b(static_cast<int>(table.size()));
            for (int i = 0; i < b.count(); ++i)
                table[i] == 'P' ? makePage(b, i) : makeObject(b, i, ++object);
            fixture.handler().processHttp(b.table());
        }
        std::string expected;
        std::istringstream records(r.records);
        for (std::string t; records >> t;) {
            const char* guid = GUID[t.back() - '0'];
            expected += t[0] == 'P' ? pageLine(guid) : objectLine(t.substr(1, t.find('@') - 1), guid);
        }
        EXPECT_EQ(expected, fixture.log()) << r.what;
        EXPECT_EQ(GUID[r.lastGuid], Access::lastGuid(fixture.handler())) << r.what;
    }
}

TEST(HttpRecords, OtherEntriesArePassedOverAndEveryHttpEntryIsTraced)
{
    HandlerFixture fixture(HTTP_ON);
    TableBuilder b(5);
    makeMedia(b, 0, "MSVD", 1);
    makePage(b, 1);
    setType(b.entry(1), "http");  // lower case: no HTTP entry
    makePage(b, 2);
    b.entry(2).detail.view.http.httpEntryType = 3;
    makePage(b, 3);
    makeObject(b, 4, 4);
    b.entry(4).detail.url = 0;
    TraceCapture trace(TRC_DETAIL);
    fixture.handler().processHttp(b.table());

    EXPECT_EQ(pageLine(GUID[0]) +
                  line("hobj", GUID[0], "N/A^N/A^N/A^N/A^N/A^0^0^0^0^0^0^0^0^0^0^0^0^N/A^N/A^N/A^N/A^N/A^N/A^4"),
              fixture.log());
    char table[32];
    snprintf(table, sizeof(table), "%p", static_cast<void*>(b.table()));
    const std::vector<std::string> expected = {
        "processing table <" + std::string(table) + ">", "  total entries <5>", "  processing entry <2> type <3>",
        "  processing entry <3> type <1>", "    writing <3> tag <hpage>",
        "    url <http://www.example.com:8080/shop/cart.html?item=7#top>", "  processing entry <4> type <2>",
        "    writing <4> tag <hobj>", "    url <N/A>"};
    std::vector<std::string> traced;
    for (const std::string& l : trace.lines())
        if (l.find(" DataHandler::processHttp: ") != std::string::npos)
            traced.push_back(l.substr(l.find("processHttp: ") + 13, l.size() - l.find("processHttp: ") - 14));
    EXPECT_EQ(expected, traced);
}

TEST(HttpRecords, TitleColumn)
{
    const struct { const char* title, *column; } rows[] = {{"Cart", "Cart"}, {"NO_TITLE_FOUND", "N/A"},
        {nullptr, "N/A"}, {"", "N/A"}, {"NO_TITLE_FOUND!", "NO_TITLE_FOUND!"}, {"NO_TITLE", "NO_TITLE"}};
    for (const auto& r : rows) {
        HandlerFixture fixture(HTTP_ON);
        TableBuilder b(1);
        makePage(b, 0);
        b.entry(0).detail.view.http.title = 0;
        if (r.title != nullptr)
            b.setText(0, b.entry(0).detail.view.http.title, r.title);
        fixture.handler().processHttp(b.table());
        EXPECT_EQ(line("hpage", GUID[0], PAGE_TO_TITLE + r.column + "^99"), fixture.log())
            << "title <" << (r.title != nullptr ? r.title : "null") << ">";
    }
}

TEST(HttpRecords, DelimiterInDetailTextsIsSubstitutedInPlaceBeforeTheTitleTest)
{
    const struct { const char* delimiter, *sub, *urlAfter, *record; } rows[] = {
        {"_", "-", "http://h/my-page.html?a-b=1#x-y",
         "<hpage>v121_92_0_wq5coll_1a2b4d000000123400000000wq5coll_"
         "4000000000_2024-03-05_12:34:56_-7_a_b/c_srv-b_65535_proxy-c_8080_1_2_3_4_-5_100_-200_2147483647_"
         "http://h/my-page.html_GET-X/Y_N/A_N/A_gz-ip_11_12_13_14_18_19_20_21_22_17_16_15_"
         "h_/my-page.html_my-page.html_a-b=1_x-y_NO-TITLE-FOUND_99</hpage>\n"},
        // The URL loses its "//" and so its host; "N/A" keeps its "/".
        {"/", "_", "http:__h_my_page.html?a_b=1#x_y",
         "<hpage>v121/92/0/wq5coll/1a2b4d000000123400000000wq5coll/"
         "4000000000/2024-03-05/12:34:56/-7/a_b/c/srv-b/65535/proxy-c/8080/1/2/3/4/-5/100/-200/2147483647/"
         "http:__h_my_page.html/GET_X_Y/N/A/N/A/gz_ip/11/12/13/14/18/19/20/21/22/17/16/15/"
         "N/A/__h_my_page.html/__h_my_page.html/a_b=1/x_y/N/A/99</hpage>\n"},
    };
    for (const auto& r : rows) {
        SCOPED_TRACE(std::string("delimiter ") + r.delimiter);
        HandlerFixture fixture({{"WQ5_LOG_HTTP", "Y"}, {"WQ5_FIELD_DELIMITER", r.delimiter}, {"WQ5_SUB_CHAR", r.sub}});
        TableBuilder b(1);
        makePage(b, 0);
        ZUB_RESPONSE_TIME_DATA& e = b.entry(0);
        setField(e.textA, "a_b/c");  // a common text: never substituted
        const char* url = b.setText(0, e.detail.url, "http://h/my_page.html?a_b=1#x_y");
        b.setText(0, e.detail.detailText1, "GET_X/Y");
        e.detail.detailText2 = 0;
        b.setText(0, e.detail.detailText3, "");
        b.setText(0, e.detail.view.http.title, "NO_TITLE_FOUND");
        setField(e.detail.view.http.httpText, "gz_ip");
        TraceCapture trace(TRC_DETAIL);
        fixture.handler().processHttp(b.table());
        EXPECT_EQ(r.record, fixture.log());
        EXPECT_STREQ(r.urlAfter, url);
        EXPECT_EQ(1, trace.count("    url <http://h/my_page.html?a_b=1#x_y>")) << "traced before the substitution";
    }
}

TEST(MediaRecords, VideoAndAudioEntriesOfTheirCodesEachWithANewGuid)
{
    HandlerFixture fixture;
    TableBuilder video(5);
    const char* codes[] = {"MSVD", "HTTP", "REAL", "MSAU", "QTIM"};
    for (int i = 0; i < 5; ++i)
        makeMedia(video, i, codes[i], i + 1, 2, 3);
    video.entry(2).registeredFlag = 0;  // only the first entry's flag counts
    TableBuilder audio(3);
    makeMedia(audio, 0, "RLAU", -4, 5, 2147483647);
    ZUB_RESPONSE_TIME_DATA& e = audio.entry(0);
    audio.setText(0, e.detail.url, "rtsp://m/clip");
    audio.setText(0, e.detail.detailText1, "");
    const char* text2 = audio.setText(0, e.detail.detailText2, "a^^b");
    audio.setText(0, e.detail.detailText3, "mp3");
    setField(e.detail.view.media.mediaText, "codec^x");
    makeMedia(audio, 1, "MSVD", 1);
    makeMedia(audio, 2, "MSAU", 2);
    fixture.handler().processVideo(video.table());
    fixture.handler().processAudio(audio.table());

    EXPECT_EQ(videoLine(GUID[0], "1^2^3") + line("video", GUID[1], "6^N/A^N/A^N/A^N/A^N/A^3^2^3") +
                  line("video", GUID[2], "7^N/A^N/A^N/A^N/A^N/A^5^2^3") +
                  line("audio", GUID[3], "10^rtsp://m/clip^N/A^a__b^mp3^codec_x^-4^5^2147483647") +
                  line("audio", GUID[4], "9^N/A^N/A^N/A^N/A^N/A^2^0^0"),
              fixture.log());
    EXPECT_STREQ("a__b", text2);
    EXPECT_STREQ("codec_x", e.detail.view.media.mediaText);
    EXPECT_EQ(GUID[4], Access::lastGuid(fixture.handler()));
}

TEST(MediaRecords, FiftyPercentCountsEveryEntryOfTheTable)
{
    HandlerFixture fixture({{"WQ5_LOG_SAMPLE_PERCENTAGE", "50"}, {"WQ5_LOG_HTTP", "Y"}});
    TableBuilder b(4);
    for (int i = 0; i < 4; ++i)
        makeMedia(b, i, "MSVD", i);
    fixture.handler().processVideo(b.table());
    // The sampler passes entries 0 and 2 again, which are no video entries now.
    setType(b.entry(0), "HTTP");
    setType(b.entry(2), "HTTP");
    fixture.handler().processVideo(b.table());
    // The HTTP page sampler has not moved: its first page passes.
    TableBuilder page(1);
    makePage(page, 0);
    fixture.handler().processHttp(page.table());
    EXPECT_EQ(videoLine(GUID[0], "0^0^0") + videoLine(GUID[1], "2^0^0") + pageLine(GUID[2]), fixture.log());
}

TEST(TableWalk, TablesWithNothingToWalkWriteNothingAndMoveNoSampler)
{
    const struct { const char* what; int32_t count; bool entries; uint32_t firstFlag; int disconnects; } rows[] = {
        {"first entry unregistered, later ones valid", 2, true, 0, 3}, {"negative count", -1, true, 1, 0},
        {"most negative count", INT32_MIN, true, 1, 0}, {"zero count", 0, true, 1, 0},
        {"zero count, first entry unregistered: the flag is read first", 0, true, 0, 3},
        {"no entry area", 2, false, 0, 0}};
    const auto all = {&DataHandler::processHttp, &DataHandler::processVideo, &DataHandler::processAudio};
    for (const auto& r : rows) {
        HandlerFixture fixture({{"WQ5_LOG_HTTP", "Y"}, {"WQ5_LOG_SAMPLE_PERCENTAGE", "50"}});
        TableBuilder b(2);
        makePage(b, 0);
        makeMedia(b, 1, "MSVD", 1);
        b.entry(0).registeredFlag = r.firstFlag;
        b.table()->entryCount = r.count;
        b.setEntriesRef(r.entries);
        TraceCapture trace(TRC_DETAIL);
        for (auto process : all)
            (fixture.handler().*process)(b.table());
        std::string decisions;  // a sampler that has counted nothing passes one record, then drops one
        for (int kind = 0; kind < 6; ++kind)
            decisions += Access::sampler(fixture.handler(), kind / 2).checkSampling() ? 'K' : '-';
        EXPECT_EQ("", fixture.log() + Access::lastGuid(fixture.handler())) << r.what << ": no record, no GUID";
        EXPECT_EQ(r.disconnects, trace.count("disconnecting id = <0>")) << r.what;
        EXPECT_EQ("K-K-K-", decisions) << r.what;
    }
    // Null tables; a handler without settings, writer or samplers; a log that cannot be opened.
    HandlerFixture fixture(HTTP_ON);
    ASSERT_EQ(0, rmdir(fixture.logDir().c_str()));
    DataHandler bare(nullptr);
    TableBuilder b(3);
    makePage(b, 0);
    makePage(b, 1);
    makeMedia(b, 2, "MSVD", 1);
    TraceCapture trace(TRC_ERROR);
    for (auto process : all) {
        (fixture.handler().*process)(nullptr);
        (bare.*process)(b.table());
        (fixture.handler().*process)(b.table());
    }
    EXPECT_EQ("", Access::lastGuid(bare));
    EXPECT_EQ(3, trace.count("Failed to open log file.")) << "each record tells, the walk goes on";
    EXPECT_EQ(GUID[2], Access::lastGuid(fixture.handler()));
}

TEST(TextBounds, TextsFillingTheirFieldOrShortStampsAreReadWithinThem)
{
    HandlerFixture fixture(HTTP_ON);
    TableBuilder b(5);
    makePage(b, 0);
    makeMedia(b, 1, "MSVD", 0x5E5E5E5E);
    ZUB_RESPONSE_TIME_DATA& e = b.entry(0);
    setField(e.stampText, "ABCD2024-03-05T12:34:56.7890123X");  // all 32 characters, no NUL
    setField(e.textA, std::string(40, 'A'));
    setField(e.textB, std::string(16, 'B'));
    setField(e.textC, std::string(24, 'C'));
    // Full texts holding the delimiter, each followed by a number whose bytes are all the delimiter.
    setField(e.detail.view.http.httpText, "^" + std::string(30, 'h') + "^");
    e.detail.view.http.httpInt0 = 0x5E5E5E5E;
    setField(b.entry(1).detail.view.media.mediaText, "^" + std::string(30, 'm') + "^");
    const char* const stamps[][2] = {{"ABCD2024-03-05T1", "2024-03-05^1"}, {"ABCD2024", "2024^"}, {"", "^"}};
    for (int i = 2; i < 5; ++i)
        setField(makeEntry(b, i, "MSVD", 0).stampText, stamps[i - 2][0]);
    fixture.handler().processHttp(b.table());
    fixture.handler().processVideo(b.table());

    std::string page = PAGE_TO_TITLE + "Cart^1583242846";
    page.replace(page.find("keep-alive"), 10, "_" + std::string(30, 'h') + "_");
    std::string expected = line("hpage", GUID[0], page,
                                "4000000000^2024-03-05^12:34:56^-7^" + std::string(40, 'A') + "^" +
                                    std::string(16, 'B') + "^65535^" + std::string(24, 'C') +
                                    "^8080^1^2^3^4^-5^100^-200^2147483647^") +
                           line("video", GUID[1], "5^N/A^N/A^N/A^N/A^_" + std::string(30, 'm') + "_^1583242846^0^0");
    for (int i = 2; i < 5; ++i)
        expected += videoLine(GUID[i], "0^0^0", "4000000000^" + std::string(stamps[i - 2][1]) + COMMON_TAIL);
    EXPECT_EQ(expected, fixture.log());
}

TEST(TextBounds, RecordsAroundAndBeyondTheBufferAreWrittenWhole)
{
    // Records of `length` bytes, reached through detailText1.
    const struct { std::string tag; size_t length; } rows[] = {
        {"video", 32767}, {"video", 32768}, {"video", 32769}, {"hobj", 32768}, {"hobj", 90000}};
    for (const auto& r : rows) {
        SCOPED_TRACE(r.tag + " record of " + std::to_string(r.length) + " bytes");
        HandlerFixture fixture(HTTP_ON);
        const bool video = r.tag == "video";
        const std::string head = "<" + r.tag + ">v121^92^0^wq5coll^" + GUID[0] + "^" + COMMON +
                                 (video ? "5^N/A^" : "http://h/1^");
        const std::string tail = (video ? "^N/A^N/A^N/A^1^2^3</video>\n"
                                        : "^N/A^N/A^N/A^0^0^0^0^0^0^0^0^0^0^0^0^h^/1^1^N/A^N/A^N/A^1</hobj>\n");
        const std::string pad(r.length - head.size() - tail.size(), 'x');
        TableBuilder b(1, r.length);
        video ? makeMedia(b, 0, "MSVD", 1, 2, 3) : makeObject(b, 0, 1);
        b.setText(0, b.entry(0).detail.detailText1, pad);
        TraceCapture trace(TRC_ERROR);
        video ? fixture.handler().processVideo(b.table()) : fixture.handler().processHttp(b.table());
        EXPECT_EQ(head + pad + tail, fixture.log());
        EXPECT_TRUE(trace.lines().empty());
    }
}

TEST(Guid, MadeOfItsPartsCutAfter64CharactersCounterWraps)
{
    const std::string cut = "1a2b4d000000123400000000" + std::string(40, 'n');
    const struct { unsigned long pid; time_t time; int random; uint32_t counter; std::string name;
                   const char* calls; std::vector<std::string> guids; } rows[] = {  // calls: n generateGuid, l getGuid
        {6699, 1291845632, 4660, 0, "wq5coll", "nnl", {GUID[0], GUID[1], GUID[1]}},
        {16, 32, 48, 0, "x", "llnl", {"10203000000000x", "10203000000000x", "10203000000001x", "10203000000001x"}},
        {1, 2, 3, 0xFFFFFFFEu, "c", "nnnn", {"123fffffffec", "123ffffffffc", "12300000000c", "12300000001c"}},
        {6699, 1291845632, 4660, 0, std::string(100, 'n'), "nl", {cut, cut}}};
    for (const auto& r : rows) {
        DataHandler handler(nullptr);
        Access::fixGuid(handler, r.pid, r.time, r.random, r.counter, r.name);
        std::vector<std::string> guids;
        for (const char* call = r.calls; *call != '\0'; ++call)
            guids.push_back(*call == 'n' ? handler.generateGuid() : handler.getGuid());
        EXPECT_EQ(r.guids, guids) << "name " << r.name.substr(0, 10) << ", calls " << r.calls;
    }
}

}  // namespace

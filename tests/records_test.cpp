// Whole records, byte for byte: HTTP pages and objects, video and audio,
// the record pieces, delimiter substitution, GUIDs and the table walk.
#include <gtest/gtest.h>

#include <climits>
#include <cstring>
#include <string>

#include "support/handler_fixture.h"
#include "support/table_builder.h"
#include "support/trace_capture.h"

namespace {

using wq5test::GUID0;
using wq5test::GUID1;
using wq5test::GUID2;
using wq5test::GUID3;
using wq5test::HandlerFixture;
using wq5test::Settings;
using wq5test::setField;
using wq5test::setType;
using wq5test::TableBuilder;
typedef DataHandlerTestAccess Access;

const Settings HTTP_ON = {{"WQ5_LOG_HTTP", "Y"}, {"WQ5_LOG_HTTPOBJ", "Y"}};

// ------------------------------------------------------------ test entries

// The common part every test entry carries, and its 17 columns.
void fillCommon(ZUB_RESPONSE_TIME_DATA& e)
{
    setField(e.stampText, "ABCD2024-03-05T12:34:56");
    e.intValue = -7;
    e.ulongValue = 4000000000u;
    setField(e.textA, "client-a");
    e.ushortA = 65535;
    e.ushortB = 8080;
    setField(e.textB, "srv-b");
    setField(e.textC, "proxy-c");
    e.intMetric1 = 1;
    e.intMetric2 = 2;
    e.intMetric3 = 3;
    e.intMetric4 = 4;
    e.intMetric5 = -5;
    e.longMetric1 = 100;
    e.longMetric2 = -200;
    e.longMetric3 = 2147483647;
}
const std::string COMMON =
    "4000000000^2024-03-05^12:34:56^-7^client-a^srv-b^65535^proxy-c^8080^1^2^3^4^-5^100^-200^2147483647^";

// A page entry with every HTTP field set.
void makePage(TableBuilder& b, int i)
{
    ZUB_RESPONSE_TIME_DATA& e = b.entry(i);
    fillCommon(e);
    setType(e, "HTTP");
    ZUB_HTTP_DETAIL& h = e.detail.view.http;
    h.httpEntryType = 1;
    b.setText(i, e.detail.url, "http://www.example.com:8080/shop/cart.html?item=7#top");
    b.setText(i, e.detail.detailText1, "GET");
    b.setText(i, e.detail.detailText2, "200");
    b.setText(i, e.detail.detailText3, "text/html");
    b.setText(i, h.title, "Cart");
    setField(h.httpText, "keep-alive");
    h.httpInt0 = 99;
    h.httpInt1 = 11;
    h.httpInt2 = 12;
    h.httpInt3 = 13;
    h.httpInt4 = 14;
    h.httpInt5 = 15;
    h.httpInt6 = 16;
    h.httpInt7 = 17;
    h.httpInt8 = 18;
    h.httpInt9 = 19;
    h.httpInt10 = 20;
    h.httpInt11 = 21;
    h.httpInt12 = 22;
}
// The HTTP columns of makePage up to the title, and the last two.
const std::string PAGE_UP_TO_TITLE =
    "http://www.example.com:8080/shop/cart.html^GET^200^text/html^keep-alive^11^12^13^14^18^19^20^21^22^17^16^15^"
    "www.example.com^/shop/cart.html^cart.html^item=7^top^";
const std::string PAGE_TAIL = "Cart^99";

// An object entry: a URL, `n` as httpInt0, everything else empty.
void makeObject(TableBuilder& b, int i, const std::string& url, int n)
{
    ZUB_RESPONSE_TIME_DATA& e = b.entry(i);
    fillCommon(e);
    setType(e, "HTTP");
    e.detail.view.http.httpEntryType = 2;
    e.detail.view.http.httpInt0 = n;
    b.setText(i, e.detail.url, url);
}

void makeMedia(TableBuilder& b, int i, const char* code, int a, int c, int d)
{
    ZUB_RESPONSE_TIME_DATA& e = b.entry(i);
    fillCommon(e);
    setType(e, code);
    e.detail.view.media.mediaInt0 = a;
    e.detail.view.media.mediaInt1 = c;
    e.detail.view.media.mediaInt2 = d;
}

std::string header(const std::string& tag, const std::string& guid)
{
    return "<" + tag + ">v121^92^0^wq5coll^" + guid + "^";
}

std::string pageLine(const std::string& guid)
{
    return header("hpage", guid) + COMMON + PAGE_UP_TO_TITLE + PAGE_TAIL + "</hpage>\n";
}

// ------------------------------------------------------------ HTTP records

TEST(HttpRecords, PageAndThreeObjectsShareThePageGuid)
{
    HandlerFixture fixture(HTTP_ON);
    TableBuilder b(4);
    makePage(b, 0);
    makeObject(b, 1, "http://img.example.com/pics/a.png", 1);
    makeObject(b, 2, "http://img.example.com/pics/b.png?s=2", 2);
    makeObject(b, 3, "http://img.example.com/", 3);
    fixture.handler().processHttp(b.table());

    const std::string expected =
        "<hpage>v121^92^0^wq5coll^1a2b4d000000123400000000wq5coll^"
        "4000000000^2024-03-05^12:34:56^-7^client-a^srv-b^65535^proxy-c^8080^1^2^3^4^-5^100^-200^2147483647^"
        "http://www.example.com:8080/shop/cart.html^GET^200^text/html^keep-alive^11^12^13^14^18^19^20^21^22^17^16^15^"
        "www.example.com^/shop/cart.html^cart.html^item=7^top^Cart^99</hpage>\n"
        "<hobj>v121^92^0^wq5coll^1a2b4d000000123400000000wq5coll^"
        "4000000000^2024-03-05^12:34:56^-7^client-a^srv-b^65535^proxy-c^8080^1^2^3^4^-5^100^-200^2147483647^"
        "http://img.example.com/pics/a.png^N/A^N/A^N/A^N/A^0^0^0^0^0^0^0^0^0^0^0^0^"
        "img.example.com^/pics/a.png^a.png^N/A^N/A^N/A^1</hobj>\n"
        "<hobj>v121^92^0^wq5coll^1a2b4d000000123400000000wq5coll^"
        "4000000000^2024-03-05^12:34:56^-7^client-a^srv-b^65535^proxy-c^8080^1^2^3^4^-5^100^-200^2147483647^"
        "http://img.example.com/pics/b.png^N/A^N/A^N/A^N/A^0^0^0^0^0^0^0^0^0^0^0^0^"
        "img.example.com^/pics/b.png^b.png^s=2^N/A^N/A^2</hobj>\n"
        "<hobj>v121^92^0^wq5coll^1a2b4d000000123400000000wq5coll^"
        "4000000000^2024-03-05^12:34:56^-7^client-a^srv-b^65535^proxy-c^8080^1^2^3^4^-5^100^-200^2147483647^"
        "http://img.example.com/^N/A^N/A^N/A^N/A^0^0^0^0^0^0^0^0^0^0^0^0^"
        "img.example.com^/^N/A^N/A^N/A^N/A^3</hobj>\n";
    EXPECT_EQ(expected, fixture.log());
    EXPECT_EQ(GUID0, Access::lastGuid(fixture.handler()));
}

TEST(HttpRecords, ObjectsWithThePageSwitchOffCarryTheUnwrittenPagesGuid)
{
    HandlerFixture fixture(Settings{{"WQ5_LOG_HTTP", "N"}, {"WQ5_LOG_HTTPOBJ", "Y"}});
    TableBuilder first(4);
    makePage(first, 0);
    makeObject(first, 1, "http://h/1", 1);
    makeObject(first, 2, "http://h/2", 2);
    makeObject(first, 3, "http://h/3", 3);
    fixture.handler().processHttp(first.table());
    // A later page moves the GUID on although its record is not written.
    TableBuilder second(2);
    makePage(second, 0);
    makeObject(second, 1, "http://h/4", 4);
    fixture.handler().processHttp(second.table());

    const std::string rest = "^N/A^N/A^N/A^N/A^0^0^0^0^0^0^0^0^0^0^0^0^h^/";
    const std::string expected =
        header("hobj", GUID0) + COMMON + "http://h/1" + rest + "1^1^N/A^N/A^N/A^1</hobj>\n" +
        header("hobj", GUID0) + COMMON + "http://h/2" + rest + "2^2^N/A^N/A^N/A^2</hobj>\n" +
        header("hobj", GUID0) + COMMON + "http://h/3" + rest + "3^3^N/A^N/A^N/A^3</hobj>\n" +
        header("hobj", GUID1) + COMMON + "http://h/4" + rest + "4^4^N/A^N/A^N/A^4</hobj>\n";
    EXPECT_EQ(expected, fixture.log());
}

TEST(HttpRecords, PagesWithThePageSwitchOffStillMakeGuids)
{
    // Only secure HTTP on: nothing is written, every page makes a GUID.
    HandlerFixture fixture(Settings{{"WQ5_LOG_HTTPS", "Y"}});
    TableBuilder b(3);
    makePage(b, 0);
    makeObject(b, 1, "http://h/1", 1);
    makePage(b, 2);
    fixture.handler().processHttp(b.table());
    EXPECT_EQ("", fixture.log());
    EXPECT_EQ(GUID1, Access::lastGuid(fixture.handler()));
}

TEST(HttpRecords, ObjectsBeforeAnyPageShareTheGuidTheFirstOneMade)
{
    HandlerFixture fixture(HTTP_ON);
    TableBuilder first(2);
    makeObject(first, 0, "http://h/1", 1);
    makeObject(first, 1, "http://h/2", 2);
    fixture.handler().processHttp(first.table());
    // An object in a later table follows the last GUID of the handler.
    TableBuilder second(1);
    makeObject(second, 0, "http://h/3", 3);
    fixture.handler().processHttp(second.table());

    const std::string rest = "^N/A^N/A^N/A^N/A^0^0^0^0^0^0^0^0^0^0^0^0^h^/";
    const std::string expected =
        header("hobj", GUID0) + COMMON + "http://h/1" + rest + "1^1^N/A^N/A^N/A^1</hobj>\n" +
        header("hobj", GUID0) + COMMON + "http://h/2" + rest + "2^2^N/A^N/A^N/A^2</hobj>\n" +
        header("hobj", GUID0) + COMMON + "http://h/3" + rest + "3^3^N/A^N/A^N/A^3</hobj>\n";
    EXPECT_EQ(expected, fixture.log());
}

TEST(HttpRecords, ObjectsFollowTheSamplingDecisionOfTheirPage)
{
    // 50 %: pages pass and drop in turn, and their objects with them; an
    // object at the head of a table follows the latest page decision.
    HandlerFixture fixture(Settings{{"WQ5_LOG_HTTP", "Y"}, {"WQ5_LOG_HTTPOBJ", "Y"}, {"WQ5_LOG_SAMPLE_PERCENTAGE", "50"}});
    TableBuilder first(4);
    makePage(first, 0);                     // passes, GUID0
    makeObject(first, 1, "http://h/1", 1);  // written
    makePage(first, 2);                     // dropped, GUID1
    makeObject(first, 3, "http://h/2", 2);  // dropped with it
    fixture.handler().processHttp(first.table());
    TableBuilder second(3);
    makeObject(second, 0, "http://h/3", 3);  // follows the dropped page
    makePage(second, 1);                     // passes, GUID2
    makeObject(second, 2, "http://h/4", 4);  // written
    fixture.handler().processHttp(second.table());

    const std::string rest = "^N/A^N/A^N/A^N/A^0^0^0^0^0^0^0^0^0^0^0^0^h^/";
    const std::string expected = pageLine(GUID0) + header("hobj", GUID0) + COMMON + "http://h/1" + rest +
                                 "1^1^N/A^N/A^N/A^1</hobj>\n" + pageLine(GUID2) + header("hobj", GUID2) + COMMON +
                                 "http://h/4" + rest + "4^4^N/A^N/A^N/A^4</hobj>\n";
    EXPECT_EQ(expected, fixture.log());
}

TEST(HttpRecords, OnlyHttpEntriesOfType1And2AreWritten)
{
    HandlerFixture fixture(HTTP_ON);
    TableBuilder b(4);
    makeMedia(b, 0, "MSVD", 1, 2, 3);
    makePage(b, 1);
    setType(b.entry(1), "http");  // lower case: not an HTTP entry
    makePage(b, 2);
    b.entry(2).detail.view.http.httpEntryType = 3;
    makePage(b, 3);
    b.entry(3).detail.view.http.httpEntryType = 0;

    TraceCapture trace(TRC_DETAIL);
    fixture.handler().processHttp(b.table());
    EXPECT_EQ("", fixture.log());
    EXPECT_EQ(1, trace.count("  total entries <4>"));
    EXPECT_EQ(0, trace.count("  processing entry <0> type <0>"));
    EXPECT_EQ(0, trace.count("  processing entry <1> type <1>"));
    EXPECT_EQ(1, trace.count("  processing entry <2> type <3>"));
    EXPECT_EQ(1, trace.count("  processing entry <3> type <0>"));
    EXPECT_EQ(-1, trace.indexOf("    writing <2> tag <hpage>"));
    EXPECT_EQ("", Access::lastGuid(fixture.handler()));
}

TEST(HttpRecords, TraceLinesOfAWrittenPage)
{
    HandlerFixture fixture(HTTP_ON);
    TableBuilder b(2);
    makePage(b, 0);
    makeObject(b, 1, "", 1);
    TraceCapture trace(TRC_DETAIL);
    fixture.handler().processHttp(b.table());

    const char* const expected[] = {
        "  total entries <2>",
        "  processing entry <0> type <1>",
        "    writing <0> tag <hpage>",
        "    url <http://www.example.com:8080/shop/cart.html?item=7#top>",
        "  processing entry <1> type <2>",
        "    writing <1> tag <hobj>",
        "    url <N/A>",
    };
    int last = -1;
    for (const char* line : expected) {
        const int at = trace.indexOf(line);
        EXPECT_GT(at, last) << "line <" << line << "> missing or out of order";
        last = at;
    }
    EXPECT_EQ(0, trace.count("Failed to open log file."));
}

struct TitleCase {
    const char* name;
    const char* title;  // null: no title reference
    const char* column;
};

TEST(HttpRecords, TitleColumn)
{
    const TitleCase cases[] = {
        {"plain", "Cart", "Cart"},
        {"NO_TITLE_FOUND", "NO_TITLE_FOUND", "N/A"},
        {"null", nullptr, "N/A"},
        {"empty", "", "N/A"},
        {"longer than the marker", "NO_TITLE_FOUND!", "NO_TITLE_FOUND!"},
        {"shorter than the marker", "NO_TITLE", "NO_TITLE"},
    };
    for (const TitleCase& c : cases) {
        SCOPED_TRACE(c.name);
        HandlerFixture fixture(HTTP_ON);
        TableBuilder b(1);
        makePage(b, 0);
        b.entry(0).detail.view.http.title = 0;
        if (c.title != nullptr)
            b.setText(0, b.entry(0).detail.view.http.title, c.title);
        fixture.handler().processHttp(b.table());
        EXPECT_EQ(header("hpage", GUID0) + COMMON + PAGE_UP_TO_TITLE + c.column + "^99</hpage>\n", fixture.log());
    }
}

TEST(HttpRecords, NullUrlGivesNAInEveryUrlColumn)
{
    HandlerFixture fixture(HTTP_ON);
    TableBuilder b(1);
    makePage(b, 0);
    b.entry(0).detail.url = 0;
    TraceCapture trace(TRC_DETAIL);
    fixture.handler().processHttp(b.table());
    EXPECT_EQ(header("hpage", GUID0) + COMMON +
                  "N/A^GET^200^text/html^keep-alive^11^12^13^14^18^19^20^21^22^17^16^15^N/A^N/A^N/A^N/A^N/A^"
                  "Cart^99</hpage>\n",
              fixture.log());
    EXPECT_EQ(1, trace.count("    url <N/A>"));
}

TEST(HttpRecords, UnderscoreDelimiterWithDashSubstitute)
{
    HandlerFixture fixture(Settings{{"WQ5_LOG_HTTP", "Y"}, {"WQ5_FIELD_DELIMITER", "_"}, {"WQ5_SUB_CHAR", "-"}});
    TableBuilder b(1);
    makePage(b, 0);
    ZUB_RESPONSE_TIME_DATA& e = b.entry(0);
    char* url = b.setText(0, e.detail.url, "http://h/my_page.html?a_b=1#x_y");
    b.setText(0, e.detail.detailText1, "GET_X");
    e.detail.detailText2 = 0;
    b.setText(0, e.detail.detailText3, "");
    char* title = b.setText(0, e.detail.view.http.title, "NO_TITLE_FOUND");
    setField(e.detail.view.http.httpText, "gz_ip");

    TraceCapture trace(TRC_DETAIL);
    fixture.handler().processHttp(b.table());

    // The title is compared after the substitution, so it is kept.
    EXPECT_EQ("<hpage>v121_92_0_wq5coll_1a2b4d000000123400000000wq5coll_"
              "4000000000_2024-03-05_12:34:56_-7_client-a_srv-b_65535_proxy-c_8080_1_2_3_4_-5_100_-200_2147483647_"
              "http://h/my-page.html_GET-X_N/A_N/A_gz-ip_11_12_13_14_18_19_20_21_22_17_16_15_"
              "h_/my-page.html_my-page.html_a-b=1_x-y_NO-TITLE-FOUND_99</hpage>\n",
              fixture.log());
    // The trace shows the URL as delivered; the entry keeps the change.
    EXPECT_EQ(1, trace.count("    url <http://h/my_page.html?a_b=1#x_y>"));
    EXPECT_STREQ("http://h/my-page.html?a-b=1#x-y", url);
    EXPECT_STREQ("NO-TITLE-FOUND", title);
    EXPECT_STREQ("gz-ip", e.detail.view.http.httpText);
}

TEST(HttpRecords, SlashDelimiterIsLeftInsideNA)
{
    HandlerFixture fixture(Settings{{"WQ5_LOG_HTTP", "Y"}, {"WQ5_FIELD_DELIMITER", "/"}});
    TableBuilder b(1);
    ZUB_RESPONSE_TIME_DATA& e = b.entry(0);
    fillCommon(e);
    setType(e, "HTTP");
    e.detail.view.http.httpEntryType = 1;
    e.detail.view.http.httpInt0 = 5;
    b.setText(0, e.detail.url, "http://h/a");
    fixture.handler().processHttp(b.table());

    // The URL becomes http:__h_a, which has no "//" and so no host.
    EXPECT_EQ("<hpage>v121/92/0/wq5coll/1a2b4d000000123400000000wq5coll/"
              "4000000000/2024-03-05/12:34:56/-7/client-a/srv-b/65535/proxy-c/8080/1/2/3/4/-5/100/-200/2147483647/"
              "http:__h_a/N/A/N/A/N/A/N/A/0/0/0/0/0/0/0/0/0/0/0/0/N/A/__h_a/__h_a/N/A/N/A/N/A/5</hpage>\n",
              fixture.log());
}

TEST(HttpRecords, DelimiterInsideACommonTextStays)
{
    HandlerFixture fixture(Settings{{"WQ5_LOG_HTTP", "Y"}, {"WQ5_FIELD_DELIMITER", "|"}});
    TableBuilder b(1);
    makePage(b, 0);
    setField(b.entry(0).textA, "a|b");
    b.setText(0, b.entry(0).detail.detailText1, "G|T");
    fixture.handler().processHttp(b.table());
    EXPECT_EQ("<hpage>v121|92|0|wq5coll|1a2b4d000000123400000000wq5coll|"
              "4000000000|2024-03-05|12:34:56|-7|a|b|srv-b|65535|proxy-c|8080|1|2|3|4|-5|100|-200|2147483647|"
              "http://www.example.com:8080/shop/cart.html|G_T|200|text/html|keep-alive|11|12|13|14|18|19|20|21|22|"
              "17|16|15|www.example.com|/shop/cart.html|cart.html|item=7|top|Cart|99</hpage>\n",
              fixture.log());
}

// ------------------------------------------------------------ media records

TEST(MediaRecords, NullTextsAndNumbersOneTwoThree)
{
    HandlerFixture fixture;
    TableBuilder b(1);
    makeMedia(b, 0, "MSVD", 1, 2, 3);
    fixture.handler().processVideo(b.table());
    EXPECT_EQ("<video>v121^92^0^wq5coll^1a2b4d000000123400000000wq5coll^"
              "4000000000^2024-03-05^12:34:56^-7^client-a^srv-b^65535^proxy-c^8080^1^2^3^4^-5^100^-200^2147483647^"
              "5^N/A^N/A^N/A^N/A^N/A^1^2^3</video>\n",
              fixture.log());
}

TEST(MediaRecords, VideoCodesEachWithANewGuid)
{
    HandlerFixture fixture;
    TableBuilder b(5);
    makeMedia(b, 0, "QTIM", -1, 0, 2147483647);
    makeMedia(b, 1, "HTTP", 0, 0, 0);  // not a video entry
    makeMedia(b, 2, "REAL", 6, 6, 6);
    makeMedia(b, 3, "MSAU", 9, 9, 9);  // audio, not video
    makeMedia(b, 4, "MSVD", 5, 5, 5);
    fixture.handler().processVideo(b.table());
    EXPECT_EQ(header("video", GUID0) + COMMON + "7^N/A^N/A^N/A^N/A^N/A^-1^0^2147483647</video>\n" +
                  header("video", GUID1) + COMMON + "6^N/A^N/A^N/A^N/A^N/A^6^6^6</video>\n" +
                  header("video", GUID2) + COMMON + "5^N/A^N/A^N/A^N/A^N/A^5^5^5</video>\n",
              fixture.log());
    EXPECT_EQ(GUID2, Access::lastGuid(fixture.handler()));
}

TEST(MediaRecords, AudioTextsAreSubstitutedInPlace)
{
    HandlerFixture fixture;
    TableBuilder b(3);
    makeMedia(b, 0, "RLAU", -1, 0, 7);
    ZUB_RESPONSE_TIME_DATA& e = b.entry(0);
    b.setText(0, e.detail.url, "rtsp://media.example.com/clip");
    b.setText(0, e.detail.detailText1, "");
    char* text2 = b.setText(0, e.detail.detailText2, "a^b");
    b.setText(0, e.detail.detailText3, "mp3");
    setField(e.detail.view.media.mediaText, "codec^x");
    makeMedia(b, 1, "MSVD", 1, 1, 1);  // video, not audio
    makeMedia(b, 2, "MSAU", 2, 2, 2);
    fixture.handler().processAudio(b.table());
    EXPECT_EQ(header("audio", GUID0) + COMMON + "10^rtsp://media.example.com/clip^N/A^a_b^mp3^codec_x^-1^0^7</audio>\n" +
                  header("audio", GUID1) + COMMON + "9^N/A^N/A^N/A^N/A^N/A^2^2^2</audio>\n",
              fixture.log());
    EXPECT_STREQ("a_b", text2);
    EXPECT_STREQ("codec_x", e.detail.view.media.mediaText);
}

TEST(MediaRecords, FiftyPercentCountsEveryEntryOfTheTable)
{
    {
        HandlerFixture fixture(Settings{{"WQ5_LOG_SAMPLE_PERCENTAGE", "50"}});
        TableBuilder b(4);
        for (int i = 0; i < 4; ++i)
            makeMedia(b, i, "MSVD", i, 0, 0);
        fixture.handler().processVideo(b.table());
        EXPECT_EQ(header("video", GUID0) + COMMON + "5^N/A^N/A^N/A^N/A^N/A^0^0^0</video>\n" +
                      header("video", GUID1) + COMMON + "5^N/A^N/A^N/A^N/A^N/A^2^0^0</video>\n",
                  fixture.log());
    }
    {
        // The sampler passes entries 0 and 2, which are not video entries.
        HandlerFixture fixture(Settings{{"WQ5_LOG_SAMPLE_PERCENTAGE", "50"}, {"WQ5_LOG_HTTP", "Y"}});
        TableBuilder b(4);
        makeMedia(b, 0, "HTTP", 0, 0, 0);
        makeMedia(b, 1, "MSVD", 1, 0, 0);
        makeMedia(b, 2, "HTTP", 2, 0, 0);
        makeMedia(b, 3, "MSVD", 3, 0, 0);
        fixture.handler().processVideo(b.table());
        EXPECT_EQ("", fixture.log());
        EXPECT_EQ("", Access::lastGuid(fixture.handler()));
        // The HTTP sampler has not moved: its first page passes.
        TableBuilder page(1);
        makePage(page, 0);
        fixture.handler().processHttp(page.table());
        EXPECT_EQ(pageLine(GUID0), fixture.log());
    }
}

// ------------------------------------------------------------ table walk

TEST(TableWalk, FirstEntryUnregisteredDisconnectsAndWritesNothing)
{
    HandlerFixture fixture(Settings{{"WQ5_LOG_HTTP", "Y"}, {"WQ5_LOG_SAMPLE_PERCENTAGE", "50"}});
    TableBuilder http(3);
    makePage(http, 0);
    makePage(http, 1);
    makePage(http, 2);
    http.entry(0).registeredFlag = 0;
    TableBuilder video(3);
    makeMedia(video, 0, "MSVD", 0, 0, 0);
    makeMedia(video, 1, "MSVD", 1, 0, 0);
    makeMedia(video, 2, "MSVD", 2, 0, 0);
    video.entry(0).registeredFlag = 0;
    TableBuilder audio(2);
    makeMedia(audio, 0, "MSAU", 0, 0, 0);
    makeMedia(audio, 1, "MSAU", 1, 0, 0);
    audio.entry(0).registeredFlag = 0;

    TraceCapture trace(TRC_DETAIL);
    fixture.handler().processHttp(http.table());
    fixture.handler().processVideo(video.table());
    fixture.handler().processAudio(audio.table());

    EXPECT_EQ("", fixture.log());
    EXPECT_EQ(3, trace.count("disconnecting id = <0>"));
    EXPECT_EQ(1, trace.count("  total entries <3>"));
    EXPECT_EQ(-1, trace.indexOf("  processing entry <1> type <1>"));
    EXPECT_EQ("", Access::lastGuid(fixture.handler()));
    EXPECT_EQ(0, Access::count(*Access::httpSampler(fixture.handler())));
    EXPECT_EQ(0, Access::count(*Access::videoSampler(fixture.handler())));
    EXPECT_EQ(0, Access::count(*Access::audioSampler(fixture.handler())));
}

TEST(TableWalk, LaterEntriesUnregisteredAreProcessed)
{
    HandlerFixture fixture;
    TableBuilder b(3);
    for (int i = 0; i < 3; ++i)
        makeMedia(b, i, "MSVD", i, 0, 0);
    b.entry(1).registeredFlag = 0;
    b.entry(2).registeredFlag = 0;
    TraceCapture trace(TRC_DETAIL);
    fixture.handler().processVideo(b.table());
    EXPECT_EQ(header("video", GUID0) + COMMON + "5^N/A^N/A^N/A^N/A^N/A^0^0^0</video>\n" + header("video", GUID1) +
                  COMMON + "5^N/A^N/A^N/A^N/A^N/A^1^0^0</video>\n" + header("video", GUID2) + COMMON +
                  "5^N/A^N/A^N/A^N/A^N/A^2^0^0</video>\n",
              fixture.log());
    EXPECT_EQ(0, trace.count("disconnecting id = <0>"));
}

struct CountCase {
    const char* name;
    int32_t entryCount;
    bool entriesPresent;
    uint32_t firstFlag;
    int disconnects;
};

TEST(TableWalk, TablesWithoutEntriesWriteNothing)
{
    const CountCase cases[] = {
        {"negative count", -1, true, 1, 0},
        {"most negative count", INT32_MIN, true, 1, 0},
        {"zero count", 0, true, 1, 0},
        // The flag is read before the count, as the library expects.
        {"zero count, first entry unregistered", 0, true, 0, 1},
        {"negative count, first entry unregistered", -3, true, 0, 1},
        // Nothing is read through a null entry reference.
        {"null entries", 2, false, 0, 0},
    };
    for (const CountCase& c : cases) {
        SCOPED_TRACE(c.name);
        HandlerFixture fixture(HTTP_ON);
        TableBuilder b(2);
        makePage(b, 0);
        makeMedia(b, 1, "MSVD", 1, 2, 3);
        b.entry(0).registeredFlag = c.firstFlag;
        b.table()->entryCount = c.entryCount;
        b.setEntriesRef(c.entriesPresent);
        TraceCapture trace(TRC_DETAIL);
        fixture.handler().processHttp(b.table());
        fixture.handler().processVideo(b.table());
        fixture.handler().processAudio(b.table());
        EXPECT_EQ("", fixture.log());
        EXPECT_EQ(3 * c.disconnects, trace.count("disconnecting id = <0>"));
        EXPECT_EQ(1, trace.count("  total entries <" + std::to_string(c.entryCount) + ">"));
        EXPECT_EQ(0, trace.count("  processing entry <0> type <1>"));
    }
}

TEST(TableWalk, NullTableTracesOnlyItsFirstLine)
{
    HandlerFixture fixture(HTTP_ON);
    TraceCapture trace(TRC_DETAIL | TRC_ERROR | TRC_INFO);
    fixture.handler().processHttp(nullptr);
    fixture.handler().processVideo(nullptr);
    fixture.handler().processAudio(nullptr);
    const std::vector<std::string> all = trace.lines();
    ASSERT_EQ(3u, all.size());
    for (const std::string& line : all)
        EXPECT_NE(std::string::npos, line.find("processing table <")) << line;
    EXPECT_EQ("", fixture.log());
}

TEST(TableWalk, HandlerWithoutManagerIgnoresTables)
{
    DataHandler handler(nullptr);
    TableBuilder b(1);
    makePage(b, 0);
    b.entry(0).registeredFlag = 0;
    handler.processHttp(b.table());
    handler.processVideo(b.table());
    handler.processAudio(b.table());
    EXPECT_EQ("", Access::lastGuid(handler));
}

TEST(TableWalk, UnopenableLogIsTracedPerRecordAndProcessingGoesOn)
{
    HandlerFixture fixture(Settings{{"WQ5_LOG_HTTP", "Y"}}, false);  // no log directory
    TableBuilder b(2);
    makePage(b, 0);
    makePage(b, 1);
    TraceCapture trace(TRC_ERROR);
    fixture.handler().processHttp(b.table());
    TableBuilder v(1);
    makeMedia(v, 0, "MSVD", 1, 2, 3);
    fixture.handler().processVideo(v.table());
    EXPECT_EQ(3, trace.count("Failed to open log file."));
    EXPECT_EQ(GUID2, Access::lastGuid(fixture.handler()));
}

// ------------------------------------------------------------ text bounds

TEST(TextBounds, InlineTextsFillingTheirFieldAreReadWithinIt)
{
    HandlerFixture fixture(HTTP_ON);
    TableBuilder b(2);
    makePage(b, 0);
    makeMedia(b, 1, "MSVD", 0, 0, 0);
    for (int i = 0; i < 2; ++i) {
        ZUB_RESPONSE_TIME_DATA& e = b.entry(i);
        setField(e.stampText, "ABCD2024-03-05T12:34:56.7890123X");  // 32, no NUL
        setField(e.textA, std::string(40, 'A'));
        setField(e.textB, std::string(16, 'B'));
        setField(e.textC, std::string(24, 'C'));
    }
    // Full fields holding the delimiter, followed by an int whose bytes are
    // all the delimiter: substitution must stop at the field's end.
    ZUB_HTTP_DETAIL& http = b.entry(0).detail.view.http;
    setField(http.httpText, "^" + std::string(30, 'h') + "^");
    http.httpInt0 = 0x5E5E5E5E;
    ZUB_MEDIA_DETAIL& media = b.entry(1).detail.view.media;
    setField(media.mediaText, "^" + std::string(30, 'm') + "^");
    media.mediaInt0 = 0x5E5E5E5E;

    fixture.handler().processHttp(b.table());
    fixture.handler().processVideo(b.table());

    const std::string common = "4000000000^2024-03-05^12:34:56^-7^" + std::string(40, 'A') + "^" +
                               std::string(16, 'B') + "^65535^" + std::string(24, 'C') +
                               "^8080^1^2^3^4^-5^100^-200^2147483647^";
    const std::string httpText = "_" + std::string(30, 'h') + "_";
    const std::string mediaText = "_" + std::string(30, 'm') + "_";
    EXPECT_EQ(header("hpage", GUID0) + common +
                  "http://www.example.com:8080/shop/cart.html^GET^200^text/html^" + httpText +
                  "^11^12^13^14^18^19^20^21^22^17^16^15^www.example.com^/shop/cart.html^cart.html^item=7^top^Cart^"
                  "1583242846</hpage>\n" +
                  header("video", GUID1) + common + "5^N/A^N/A^N/A^N/A^" + mediaText + "^1583242846^0^0</video>\n",
              fixture.log());
    EXPECT_EQ(0x5E5E5E5E, http.httpInt0);
    EXPECT_EQ(0x5E5E5E5E, media.mediaInt0);
}

struct StampCase {
    const char* stamp;
    const char* date;
    const char* time;
};

TEST(TextBounds, StampCuts)
{
    const StampCase cases[] = {
        {"ABCD2024-03-05T12:34:56", "2024-03-05", "12:34:56"},
        {"ABCD2024-03-05T12:34:56.789012", "2024-03-05", "12:34:56"},
        {"ABCD2024-03-05T", "2024-03-05", ""},
        {"ABCD2024-03-05", "2024-03-05", ""},
        {"ABCD2024", "2024", ""},
        {"ABCD", "", ""},
        {"AB", "", ""},
        {"", "", ""},
        {"ABCD2024-03-05T1", "2024-03-05", "1"},
    };
    for (const StampCase& c : cases) {
        SCOPED_TRACE(std::string("stamp <") + c.stamp + ">");
        HandlerFixture fixture;
        TableBuilder b(1);
        makeMedia(b, 0, "MSVD", 1, 2, 3);
        setField(b.entry(0).stampText, c.stamp);
        fixture.handler().processVideo(b.table());
        EXPECT_EQ(header("video", GUID0) + "4000000000^" + c.date + "^" + c.time +
                      "^-7^client-a^srv-b^65535^proxy-c^8080^1^2^3^4^-5^100^-200^2147483647^"
                      "5^N/A^N/A^N/A^N/A^N/A^1^2^3</video>\n",
                  fixture.log());
    }
}

TEST(TextBounds, OverLongRecordsAreWrittenWhole)
{
    HandlerFixture fixture(HTTP_ON);
    const std::string name(40000, 'a');
    TableBuilder b(2, 100000);
    makeObject(b, 0, "http://h/" + name + ".html", 7);
    makeMedia(b, 1, "MSVD", 1, 2, 3);
    b.setText(1, b.entry(1).detail.detailText1, std::string(50000, 'b'));
    TraceCapture trace(TRC_ERROR);
    fixture.handler().processHttp(b.table());
    fixture.handler().processVideo(b.table());

    const std::string expected =
        header("hobj", GUID0) + COMMON + "http://h/" + name + ".html^N/A^N/A^N/A^N/A^0^0^0^0^0^0^0^0^0^0^0^0^h^/" +
        name + ".html^" + name + ".html^N/A^N/A^N/A^7</hobj>\n" + header("video", GUID1) + COMMON + "5^N/A^" +
        std::string(50000, 'b') + "^N/A^N/A^N/A^1^2^3</video>\n";
    EXPECT_EQ(expected, fixture.log());
    EXPECT_TRUE(trace.lines().empty());
}

TEST(TextBounds, RecordsAroundTheBufferSize)
{
    // A video record whose url column is filled so that the whole record
    // is exactly `length` bytes.
    const std::string before = header("video", GUID0) + COMMON + "5^";
    const std::string after = "^N/A^N/A^N/A^N/A^1^2^3</video>\n";
    for (size_t length : {size_t(32766), size_t(32767), size_t(32768), size_t(32769)}) {
        SCOPED_TRACE("record length " + std::to_string(length));
        HandlerFixture fixture;
        const std::string url(length - before.size() - after.size(), 'u');
        TableBuilder b(1, 40000);
        makeMedia(b, 0, "MSVD", 1, 2, 3);
        b.setText(0, b.entry(0).detail.url, url);
        fixture.handler().processVideo(b.table());
        const std::string log = fixture.log();
        EXPECT_EQ(length, log.size());
        EXPECT_EQ(before + url + after, log);
    }
}

// ------------------------------------------------------------ pieces

TEST(RecordPieces, NullArgumentsWriteNothing)
{
    DataHandler handler(nullptr);
    char buffer[8] = "xxxxxxx";
    ZUB_RESPONSE_TIME_DATA entry;
    memset(&entry, 0, sizeof(entry));
    EXPECT_EQ(0, handler.addHeader(nullptr, 8, "hpage", "g"));
    EXPECT_EQ(0, handler.addHeader(buffer, 8, nullptr, "g"));
    EXPECT_EQ(0, handler.addCommon(nullptr, 8, &entry));
    EXPECT_EQ(0, handler.addCommon(buffer, 8, nullptr));
    EXPECT_EQ(0, handler.addHttpMain(nullptr, 8, &entry));
    EXPECT_EQ(0, handler.addHttpMain(buffer, 8, nullptr));
    EXPECT_EQ(0, handler.addHttpObj(buffer, 8, nullptr));
    EXPECT_EQ(0, handler.addHttpSummary(buffer, 8, nullptr));
    EXPECT_EQ(0, handler.addFooter(nullptr, 8, "hobj"));
    EXPECT_EQ(0, handler.addFooter(buffer, 8, nullptr));
    EXPECT_STREQ("xxxxxxx", buffer);
}

TEST(RecordPieces, HeaderAndFooter)
{
    HandlerFixture fixture;
    char buffer[128];
    const std::string head = "<hpage>v121^92^0^wq5coll^" + std::string(GUID0) + "^";
    EXPECT_EQ(static_cast<int>(head.size()), fixture.handler().addHeader(buffer, sizeof(buffer), TAG_HTTPPAGE, GUID0));
    EXPECT_EQ(head, buffer);
    EXPECT_EQ(8, fixture.handler().addFooter(buffer, sizeof(buffer), TAG_HTTPOBJ));
    EXPECT_STREQ("</hobj>\n", buffer);
}

TEST(RecordPieces, APieceThatDoesNotFitIsMeasuredNotOverrun)
{
    HandlerFixture fixture;
    char buffer[16];
    memset(buffer, '#', sizeof(buffer));
    EXPECT_EQ(8, fixture.handler().addFooter(buffer, 4, TAG_HTTPOBJ));
    EXPECT_STREQ("</h", buffer);
    EXPECT_EQ('#', buffer[4]);
}

TEST(RecordPieces, ObjectAndSummaryColumnsAreThoseOfAPage)
{
    HandlerFixture fixture;
    TableBuilder b(1);
    makePage(b, 0);
    char main[512], obj[512], sum[512];
    const int n = fixture.handler().addHttpMain(main, sizeof(main), &b.entry(0));
    EXPECT_EQ(PAGE_UP_TO_TITLE + PAGE_TAIL, main);
    EXPECT_EQ(static_cast<int>(strlen(main)), n);
    EXPECT_EQ(n, fixture.handler().addHttpObj(obj, sizeof(obj), &b.entry(0)));
    EXPECT_EQ(n, fixture.handler().addHttpSummary(sum, sizeof(sum), &b.entry(0)));
    EXPECT_STREQ(main, obj);
    EXPECT_STREQ(main, sum);
}

struct ReplaceCase {
    const char* text;
    char from;
    char to;
    const char* expected;
};

TEST(Replace, SubstitutesEveryOccurrence)
{
    const ReplaceCase cases[] = {
        {"a^b^^c", '^', '_', "a_b__c"},
        {"abc", '^', '_', "abc"},
        {"^", '^', '_', "_"},
        {"", '^', '_', ""},
        {"a^b", '^', '^', "a^b"},
        {"x_y", '_', '-', "x-y"},
    };
    for (const ReplaceCase& c : cases) {
        char text[16];
        strcpy(text, c.text);
        replace(text, c.from, c.to);
        EXPECT_STREQ(c.expected, text) << "text <" << c.text << ">";
    }
    replace(nullptr, '^', '_');
}

TEST(Replace, NulDelimiterStopsAtTheTerminator)
{
    char text[] = "ab\0cd";
    replace(text, '\0', '_');
    EXPECT_EQ(0, memcmp(text, "ab\0cd", 6));
    replace(text, sizeof(text), '\0', '_');
    EXPECT_EQ(0, memcmp(text, "ab\0cd", 6));
}

TEST(Replace, BoundedFormStopsAtFieldEndOrTerminator)
{
    char text[] = "^^^^^^";
    replace(text, 4, '^', '_');
    EXPECT_STREQ("____^^", text);
    char early[] = "^\0^^";
    replace(early, 4, '^', '_');
    EXPECT_EQ(0, memcmp(early, "_\0^^", 5));
    replace(nullptr, 4, '^', '_');
}

TEST(TypeLookup, IndexOfEveryCode)
{
    const struct {
        const char* code;
        int index;
    } cases[] = {
        {"HTTP", 4}, {"MSVD", 5}, {"REAL", 6}, {"QTIM", 7},  {"QOLB", 8},  {"MSAU", 9},  {"RLAU", 10},
        {"QOLC", 11}, {"MALR", 12}, {"PKTS", 13}, {"CTXT", 14}, {"STAT", 15}, {"NONE", 0}, {"TCP ", 0},
        {"UDP ", 0}, {"http", 0},  {"MSV", 0},  {"", 0},     {"XXXX", 0},
        // Only four characters count.
        {"MSVDX", 5},
    };
    for (const auto& c : cases)
        EXPECT_EQ(c.index, typeLookup(c.code)) << "code <" << c.code << ">";
    EXPECT_EQ(0, typeLookup(nullptr));
    const char unterminated[4] = {'R', 'L', 'A', 'U'};
    EXPECT_EQ(10, typeLookup(unterminated));
}

// ------------------------------------------------------------ GUID

TEST(Guid, WorkedExample)
{
    DataHandler handler(nullptr);
    Access::fixGuid(handler, 6699, 1291845632, 4660, 0, "wq5coll");
    EXPECT_EQ("1a2b4d000000123400000000wq5coll", handler.generateGuid());
    EXPECT_EQ("1a2b4d000000123400000001wq5coll", handler.generateGuid());
    EXPECT_EQ("1a2b4d000000123400000001wq5coll", handler.getGuid());
}

TEST(Guid, CutAfterSixtyFourCharacters)
{
    DataHandler handler(nullptr);
    Access::fixGuid(handler, 6699, 1291845632, 4660, 0, std::string(100, 'n'));
    const std::string guid = handler.generateGuid();
    EXPECT_EQ("1a2b4d000000123400000000" + std::string(40, 'n'), guid);
    EXPECT_EQ(guid, handler.getGuid());
}

TEST(Guid, CounterWrapsToZero)
{
    DataHandler handler(nullptr);
    Access::fixGuid(handler, 1, 2, 3, 0xFFFFFFFEu, "c");
    EXPECT_EQ("123fffffffec", handler.generateGuid());
    EXPECT_EQ("123ffffffffc", handler.generateGuid());
    EXPECT_EQ("12300000000c", handler.generateGuid());
    EXPECT_EQ("12300000001c", handler.generateGuid());
}

TEST(Guid, GetGuidMakesOneOnlyWhenThereIsNone)
{
    DataHandler handler(nullptr);
    Access::fixGuid(handler, 0x10, 0x20, 0x30, 0, "x");
    EXPECT_EQ("10203000000000x", handler.getGuid());
    EXPECT_EQ("10203000000000x", handler.getGuid());
    EXPECT_EQ("10203000000001x", handler.generateGuid());
    EXPECT_EQ("10203000000001x", handler.getGuid());
}

}  // namespace

// HAR entries become table entries.
//
// A capture lists requests (entries), usually grouped into pages. Each page
// becomes one HTTP table: its document first, as the page entry, then every
// other request of the page as an object entry, in start-time order, so that
// the collector links the objects to the page by its GUID. Responses of a
// streaming-media content type leave the page's table and become a video or
// audio table of their own. Entries that name no page are grouped into pages
// by their documents (see groupLoose).
//
// Values that a capture does not know (absent, or -1 as HAR writes it) stay
// recognisable in the record: -1 for numbers, an empty or null text. Nothing
// is made up to fill a gap.
#include "libzub1api/har.h"

#include <algorithm>
#include <cctype>
#include <climits>
#include <cmath>
#include <cstdio>
#include <map>
#include <optional>

#include "zub/zub1rt.h"

namespace zub1sim {
namespace {

using nlohmann::json;
using Millis = std::optional<int64_t>;  // milliseconds since the epoch, UTC

constexpr int32_t UNKNOWN = -1;
constexpr size_t TEXT_A = sizeof(ZUB_RESPONSE_TIME_DATA::textA);
constexpr size_t TEXT_B = sizeof(ZUB_RESPONSE_TIME_DATA::textB);
constexpr size_t TEXT_C = sizeof(ZUB_RESPONSE_TIME_DATA::textC);
constexpr size_t HTTP_TEXT = sizeof(ZUB_HTTP_DETAIL::httpText);
constexpr size_t MEDIA_TEXT = sizeof(ZUB_MEDIA_DETAIL::mediaText);

// The streaming-media kinds, with the protocol of the filter they go to.
struct MediaKind {
    const char* code;
    uint16_t protocol;
};
const MediaKind MS_VIDEO{"MSVD", 1};
const MediaKind REAL_VIDEO{"REAL", 2};
const MediaKind QUICKTIME{"QTIM", 3};
const MediaKind MS_AUDIO{"MSAU", 5};
const MediaKind REAL_AUDIO{"RLAU", 6};

// ---- reading values leniently: a value of the wrong type is an absent one

const json& child(const json& object, const char* key)
{
    static const json NONE;
    if (!object.is_object()) return NONE;
    const auto it = object.find(key);
    return it == object.end() ? NONE : *it;
}

std::string textOf(const json& object, const char* key)
{
    const json& value = child(object, key);
    return value.is_string() ? value.get<std::string>() : std::string();
}

// A duration in milliseconds or a size in bytes, rounded to a whole number;
// -1 when absent, negative (HAR's "does not apply") or beyond 32 bits.
int32_t amountOf(const json& object, const char* key)
{
    const json& value = child(object, key);
    if (!value.is_number()) return UNKNOWN;
    const double amount = value.get<double>();
    if (!(amount >= 0) || amount > INT32_MAX) return UNKNOWN;
    return static_cast<int32_t>(std::llround(amount));
}

std::string lowered(std::string text)
{
    for (char& c : text) c = static_cast<char>(std::tolower(static_cast<unsigned char>(c)));
    return text;
}

std::string trimmed(const std::string& text)
{
    const size_t first = text.find_first_not_of(" \t");
    if (first == std::string::npos) return "";
    return text.substr(first, text.find_last_not_of(" \t") - first + 1);
}

// A record is one line: control characters in a text become blanks.
std::string printable(std::string text)
{
    for (char& c : text) {
        if (static_cast<unsigned char>(c) < 0x20 || c == 0x7f) c = ' ';
    }
    return text;
}

// A text for an inline field of `width` bytes, cut (at a UTF-8 character
// boundary) so that its terminator fits too.
std::string fitted(const std::string& text, size_t width)
{
    std::string fit = printable(text);
    if (fit.size() < width) return fit;
    size_t end = width - 1;
    while (end > 0 && (static_cast<unsigned char>(fit[end]) & 0xC0) == 0x80) --end;
    fit.resize(end);
    return fit;
}

// A text reference: null for an empty text.
json reference(const std::string& text)
{
    return text.empty() ? json() : json(printable(text));
}

// ---- time

int64_t floorDiv(int64_t a, int64_t b)
{
    return a / b - ((a % b != 0) && ((a < 0) != (b < 0)));
}

// Days since 1970-01-01 of a date of the proleptic Gregorian calendar, and
// back.
int64_t daysFromCivil(int64_t year, unsigned month, unsigned day)
{
    year -= month <= 2;
    const int64_t era = floorDiv(year, 400);
    const auto yearOfEra = static_cast<unsigned>(year - era * 400);
    const unsigned dayOfYear = (153 * (month > 2 ? month - 3 : month + 9) + 2) / 5 + day - 1;
    const unsigned dayOfEra = yearOfEra * 365 + yearOfEra / 4 - yearOfEra / 100 + dayOfYear;
    return era * 146097 + static_cast<int64_t>(dayOfEra) - 719468;
}

void civilFromDays(int64_t days, int64_t& year, unsigned& month, unsigned& day)
{
    days += 719468;
    const int64_t era = floorDiv(days, 146097);
    const auto dayOfEra = static_cast<unsigned>(days - era * 146097);
    const unsigned yearOfEra = (dayOfEra - dayOfEra / 1460 + dayOfEra / 36524 - dayOfEra / 146096) / 365;
    const unsigned dayOfYear = dayOfEra - (365 * yearOfEra + yearOfEra / 4 - yearOfEra / 100);
    const unsigned shifted = (5 * dayOfYear + 2) / 153;
    day = dayOfYear - (153 * shifted + 2) / 5 + 1;
    month = shifted < 10 ? shifted + 3 : shifted - 9;
    year = static_cast<int64_t>(yearOfEra) + era * 400 + (month <= 2);
}

// An ISO 8601 date and time as HAR writes it, "2024-03-05T14:45:12.345+01:00":
// a fraction of any length (cut to milliseconds), and a zone "Z", "+hh:mm",
// "+hhmm" or "+hh"; a time without zone is taken as UTC.
Millis parseTime(const std::string& text)
{
    size_t pos = 0;
    const auto number = [&](size_t count, int& out) {
        out = 0;
        for (size_t i = 0; i < count; ++i, ++pos) {
            if (pos >= text.size() || !std::isdigit(static_cast<unsigned char>(text[pos]))) return false;
            out = out * 10 + (text[pos] - '0');
        }
        return true;
    };
    const auto skip = [&](const char* choices) {
        if (pos >= text.size() || std::string(choices).find(text[pos]) == std::string::npos) return false;
        ++pos;
        return true;
    };
    int year = 0, month = 0, day = 0, hour = 0, minute = 0, second = 0;
    if (!number(4, year) || !skip("-") || !number(2, month) || !skip("-") || !number(2, day) ||
        !skip("Tt ") || !number(2, hour) || !skip(":") || !number(2, minute) || !skip(":") ||
        !number(2, second)) {
        return std::nullopt;
    }
    int millis = 0;
    if (skip(".,")) {
        int digits = 0;
        for (; pos < text.size() && std::isdigit(static_cast<unsigned char>(text[pos])); ++pos, ++digits) {
            if (digits < 3) millis = millis * 10 + (text[pos] - '0');
        }
        if (digits == 0) return std::nullopt;
        for (; digits < 3; ++digits) millis *= 10;
    }
    int offsetMinutes = 0;
    if (pos < text.size() && !skip("Zz")) {
        const int sign = text[pos] == '-' ? -1 : 1;
        int hours = 0, minutes = 0;
        if (!skip("+-") || !number(2, hours)) return std::nullopt;
        if (pos < text.size()) {
            skip(":");
            if (!number(2, minutes)) return std::nullopt;
        }
        if (hours > 23 || minutes > 59) return std::nullopt;
        offsetMinutes = sign * (hours * 60 + minutes);
    }
    static const unsigned MONTH_DAYS[] = {31, 29, 31, 30, 31, 30, 31, 31, 30, 31, 30, 31};
    const bool leap = (year % 4 == 0 && year % 100 != 0) || year % 400 == 0;
    if (pos != text.size() || month < 1 || month > 12 || day < 1 ||
        static_cast<unsigned>(day) > MONTH_DAYS[month - 1] || (month == 2 && day == 29 && !leap) ||
        hour > 23 || minute > 59 || second > 60) {
        return std::nullopt;
    }
    const int64_t days = daysFromCivil(year, static_cast<unsigned>(month), static_cast<unsigned>(day));
    const int64_t seconds = days * 86400 + hour * 3600 + minute * 60 + second - offsetMinutes * 60;
    return seconds * 1000 + millis;
}

// "Tue 2024-03-05 13:45:12.345 UTC": the collector takes the date from
// characters 4 to 13 and the time from characters 15 to 22. Empty when the
// time is unknown.
std::string stampOf(Millis time)
{
    static const char* const WEEKDAYS[] = {"Sun", "Mon", "Tue", "Wed", "Thu", "Fri", "Sat"};
    if (!time) return "";
    const int64_t seconds = floorDiv(*time, 1000);
    const int64_t days = floorDiv(seconds, 86400);
    const int64_t secondOfDay = seconds - days * 86400;
    int64_t year = 0;
    unsigned month = 0, day = 0;
    civilFromDays(days, year, month, day);
    if (year < 1 || year > 9999) return "";
    char stamp[ZUB_COMMON_SIZE];
    const int64_t weekday = (days % 7 + 7 + 4) % 7;  // 1970-01-01 was a Thursday
    std::snprintf(stamp, sizeof stamp, "%s %04d-%02u-%02u %02d:%02d:%02d.%03d UTC", WEEKDAYS[weekday],
                  static_cast<int>(year), month, day, static_cast<int>(secondOfDay / 3600),
                  static_cast<int>(secondOfDay / 60 % 60), static_cast<int>(secondOfDay % 60),
                  static_cast<int>(*time - seconds * 1000));
    return stamp;
}

// ---- requests and responses

// The scheme of a URL, in lower case; empty when it has none.
std::string schemeOf(const std::string& url)
{
    const size_t colon = url.find(':');
    if (colon == std::string::npos || colon == 0 || !std::isalpha(static_cast<unsigned char>(url[0]))) return "";
    for (size_t i = 0; i < colon; ++i) {
        const char c = url[i];
        if (!std::isalnum(static_cast<unsigned char>(c)) && c != '+' && c != '-' && c != '.') return "";
    }
    return lowered(url.substr(0, colon));
}

bool isNetworkScheme(const std::string& scheme)
{
    return scheme == "http" || scheme == "https" || scheme == "ws" || scheme == "wss";
}

bool isSecureScheme(const std::string& scheme) { return scheme == "https" || scheme == "wss"; }

// The server port that a URL names, or the default of its scheme; 0 when
// the port written there is no port number.
uint16_t portOf(const std::string& url, const std::string& scheme)
{
    const uint16_t fallback = isSecureScheme(scheme) ? 443 : 80;
    const size_t start = url.find("//", scheme.size());
    if (start != scheme.size() + 1) return fallback;
    std::string authority = url.substr(start + 2, url.find_first_of("/?#", start + 2) - (start + 2));
    authority = authority.substr(authority.rfind('@') == std::string::npos ? 0 : authority.rfind('@') + 1);
    const size_t bracket = authority.rfind(']');
    const size_t colon = authority.rfind(':');
    if (colon == std::string::npos || (bracket != std::string::npos && colon < bracket)) return fallback;
    const std::string digits = authority.substr(colon + 1);
    if (digits.empty()) return fallback;
    if (digits.size() > 5 || digits.find_first_not_of("0123456789") != std::string::npos) return 0;
    const long port = std::stol(digits);
    return port <= 65535 ? static_cast<uint16_t>(port) : 0;
}

// The response's content type as the capture gives it: the content's
// mimeType, else the Content-Type header.
std::string contentTypeOf(const json& response)
{
    std::string type = trimmed(textOf(child(response, "content"), "mimeType"));
    const json& headers = child(response, "headers");
    if (!type.empty() || !headers.is_array()) return type;
    for (const json& header : headers) {
        if (lowered(textOf(header, "name")) == "content-type") return trimmed(textOf(header, "value"));
    }
    return "";
}

// "Text/HTML; charset=utf-8" -> "text/html".
std::string mediaTypeOf(const std::string& contentType)
{
    return lowered(trimmed(contentType.substr(0, contentType.find(';'))));
}

// The streaming-media kind of a content type, or null for everything that
// is plain HTTP.
const MediaKind* mediaKindOf(const std::string& type)
{
    static const std::map<std::string, const MediaKind*> NAMED = {
        {"application/vnd.rn-realmedia", &REAL_VIDEO},   {"application/vnd.rn-realmedia-vbr", &REAL_VIDEO},
        {"video/vnd.rn-realvideo", &REAL_VIDEO},         {"video/x-pn-realvideo", &REAL_VIDEO},
        {"audio/vnd.rn-realaudio", &REAL_AUDIO},         {"audio/x-pn-realaudio", &REAL_AUDIO},
        {"audio/x-pn-realaudio-plugin", &REAL_AUDIO},    {"audio/x-realaudio", &REAL_AUDIO},
        {"application/vnd.ms-asf", &MS_VIDEO},
    };
    const auto named = NAMED.find(type);
    if (named != NAMED.end()) return named->second;
    if (type.rfind("video/x-ms-", 0) == 0) return &MS_VIDEO;
    if (type.rfind("video/", 0) == 0) return &QUICKTIME;
    if (type.rfind("audio/", 0) == 0) return &MS_AUDIO;
    return nullptr;
}

// A page's document: an HTML response that was served (2xx) or found
// unchanged (304). Redirects, errors and requests without response never
// are.
bool isDocument(const std::string& type, int32_t status)
{
    return (type == "text/html" || type == "application/xhtml+xml") &&
           ((status >= 200 && status <= 299) || status == 304);
}

// Bytes of the response on the wire: Chrome's _transferSize, else headers
// plus body when the capture knows both.
int32_t bytesReceived(const json& response)
{
    const int32_t transfer = amountOf(response, "_transferSize");
    if (transfer != UNKNOWN) return transfer;
    const int32_t headers = amountOf(response, "headersSize");
    const int32_t body = amountOf(response, "bodySize");
    if (headers == UNKNOWN || body == UNKNOWN || headers > INT32_MAX - body) return UNKNOWN;
    return headers + body;
}

// One network entry of the capture, its fields apart from those that
// depend on its page.
struct Item {
    uint64_t number = 0;  // position in the capture, from 1
    Millis start;
    bool secure = false;
    bool document = false;
    const MediaKind* media = nullptr;
    json fields;
};

struct Page {
    Millis start;
    std::string title;
    int32_t onContentLoad = UNKNOWN;
    int32_t onLoad = UNKNOWN;
    std::vector<Item*> items;
};

// Earlier first; an unknown time after every known one. Used with stable
// sorts, so that ties keep the capture's order.
bool startsBefore(const Millis& a, const Millis& b)
{
    if (!a || !b) return a.has_value() && !b.has_value();
    return *a < *b;
}

Item makeItem(const json& entry, uint64_t number, const std::string& url, const std::string& client)
{
    const json& request = child(entry, "request");
    const json& response = child(entry, "response");
    const json& timings = child(entry, "timings");
    const std::string scheme = schemeOf(url);
    const std::string contentType = contentTypeOf(response);
    const std::string type = mediaTypeOf(contentType);
    const int32_t status = amountOf(response, "status");
    std::string version = textOf(response, "httpVersion");
    if (version.empty()) version = textOf(request, "httpVersion");
    std::string address = textOf(entry, "serverIPAddress");
    if (address.size() >= 2 && address.front() == '[' && address.back() == ']') {
        address = address.substr(1, address.size() - 2);
    }

    Item item;
    item.number = number;
    item.start = parseTime(textOf(entry, "startedDateTime"));
    item.secure = isSecureScheme(scheme);
    item.media = mediaKindOf(type);
    item.document = isDocument(type, status);
    json& f = item.fields;
    f["ulongValue"] = number <= UINT32_MAX ? number : 0;
    f["stampText"] = stampOf(item.start);
    f["intValue"] = amountOf(entry, "time");
    f["textA"] = fitted(address, TEXT_A);
    f["textB"] = fitted(version, TEXT_B);
    f["ushortA"] = portOf(url, scheme);
    f["textC"] = fitted(client, TEXT_C);
    f["intMetric1"] = amountOf(timings, "blocked");
    f["intMetric2"] = amountOf(timings, "dns");
    f["intMetric3"] = amountOf(timings, "connect");
    f["intMetric4"] = amountOf(timings, "ssl");
    f["intMetric5"] = amountOf(timings, "send");
    f["longMetric1"] = amountOf(timings, "wait");
    f["longMetric2"] = amountOf(timings, "receive");
    f["longMetric3"] = bytesReceived(response);
    f["url"] = printable(url);
    f["detailText1"] = reference(contentType);
    f["detailText2"] = reference(textOf(response, "statusText"));
    const int32_t contentSize = amountOf(child(response, "content"), "size");
    if (item.media != nullptr) {
        f["rdType"] = item.media->code;
        f["mediaText"] = fitted(textOf(request, "method"), MEDIA_TEXT);
        f["mediaInt0"] = status;
        f["mediaInt1"] = contentSize;
        f["mediaInt2"] = amountOf(response, "bodySize");
        return item;
    }
    f["rdType"] = "HTTP";
    f["detailText3"] = reference(textOf(response, "redirectURL"));
    f["httpText"] = fitted(textOf(request, "method"), HTTP_TEXT);
    f["httpInt0"] = status;
    f["httpInt1"] = amountOf(response, "bodySize");
    f["httpInt2"] = amountOf(response, "headersSize");
    f["httpInt3"] = contentSize;
    f["httpInt4"] = amountOf(request, "headersSize");
    f["httpInt8"] = amountOf(request, "bodySize");
    f["httpInt9"] = UNKNOWN;  // page timings, for the page entry only
    f["httpInt10"] = UNKNOWN;
    f["httpInt11"] = amountOf(child(response, "content"), "compression");
    f["httpInt7"] = UNKNOWN;  // not used
    f["httpInt6"] = UNKNOWN;
    f["httpInt5"] = UNKNOWN;
    return item;
}

// Entries that name no page of the capture, in start-time order: a
// document starts a page and the requests after it are its objects; the
// requests before the first document belong to the first page. Without any
// document they make one page, led by the first of them.
std::vector<Page> groupLoose(std::vector<Item*> items)
{
    std::stable_sort(items.begin(), items.end(),
                     [](const Item* a, const Item* b) { return startsBefore(a->start, b->start); });
    std::vector<Page> pages;
    std::vector<Item*> leading;
    for (Item* item : items) {
        if (item->document) {
            pages.emplace_back();
            if (pages.size() == 1) pages.back().items.swap(leading);
        } else if (pages.empty()) {
            leading.push_back(item);
            continue;
        }
        pages.back().items.push_back(item);
    }
    if (pages.empty() && !leading.empty()) {
        pages.emplace_back();
        pages.back().items.swap(leading);
    }
    for (Page& page : pages) page.start = page.items.front()->start;
    return pages;
}

int32_t sinceStart(const Millis& pageStart, const Millis& start)
{
    if (!pageStart || !start) return UNKNOWN;
    const int64_t offset = *start - *pageStart;
    return offset >= INT32_MIN && offset <= INT32_MAX ? static_cast<int32_t>(offset) : UNKNOWN;
}

// The tables of one page: its HTTP table (document first), then one table
// per media entry.
void emitPage(Page& page, uint16_t number, std::vector<json>& tables)
{
    std::stable_sort(page.items.begin(), page.items.end(), [](const Item* a, const Item* b) {
        return startsBefore(a->start, b->start);
    });
    std::vector<Item*> http;
    for (Item* item : page.items) {
        item->fields["ushortB"] = number;
        if (item->media == nullptr) {
            item->fields["httpInt12"] = sinceStart(page.start, item->start);
            http.push_back(item);
        }
    }
    if (!http.empty()) {
        const auto document =
            std::find_if(http.begin(), http.end(), [](const Item* item) { return item->document; });
        if (document != http.end()) std::rotate(http.begin(), document, document + 1);
        json entries = json::array();
        for (Item* item : http) {
            json& f = item->fields;
            f["httpEntryType"] = entries.empty() ? 1 : 2;
            if (entries.empty()) {
                f["title"] = reference(page.title);
                f["httpInt9"] = page.onContentLoad;
                f["httpInt10"] = page.onLoad;
            }
            entries.push_back(std::move(f));
        }
        tables.push_back({{"filter", {0, http.front()->secure ? 443 : 80}}, {"entries", std::move(entries)}});
    }
    for (Item* item : page.items) {
        if (item->media == nullptr) continue;
        item->fields["detailText3"] = reference(page.title);
        tables.push_back({{"filter", {item->media->protocol, 0}},
                          {"entries", json::array({std::move(item->fields)})}});
    }
}

}  // namespace

bool looksLikeHar(const std::string& start)
{
    size_t pos = start.compare(0, 3, "\xEF\xBB\xBF") == 0 ? 3 : 0;
    const auto blanks = [&] {
        while (pos < start.size() && std::isspace(static_cast<unsigned char>(start[pos]))) ++pos;
    };
    blanks();
    if (pos >= start.size() || start[pos] != '{') return false;
    ++pos;
    blanks();
    return start.compare(pos, 5, "\"log\"") == 0;
}

bool convertHar(const std::string& content, HarReplay& replay, std::string& error)
{
    replay = HarReplay();
    json doc;
    try {
        const size_t bom = content.compare(0, 3, "\xEF\xBB\xBF") == 0 ? 3 : 0;
        doc = json::parse(content.begin() + static_cast<std::ptrdiff_t>(bom), content.end());
    } catch (const json::exception& e) {
        error = printable(std::string("invalid JSON: ") + e.what());
        return false;
    }
    const json& log = child(doc, "log");
    const json& entries = child(log, "entries");
    if (!log.is_object()) {
        error = "no \"log\" object";
        return false;
    }
    if (!entries.is_array()) {
        error = "\"log\" has no \"entries\" array";
        return false;
    }
    std::string client = textOf(child(log, "browser"), "name");
    if (client.empty()) client = textOf(child(log, "creator"), "name");

    std::vector<Page> pages;
    std::map<std::string, size_t> pageIndex;
    const json& pageList = child(log, "pages");
    if (pageList.is_array()) {
        for (const json& record : pageList) {
            const std::string id = textOf(record, "id");
            if (id.empty() || pageIndex.count(id) != 0) continue;
            Page page;
            page.start = parseTime(textOf(record, "startedDateTime"));
            page.title = textOf(record, "title");
            page.onContentLoad = amountOf(child(record, "pageTimings"), "onContentLoad");
            page.onLoad = amountOf(child(record, "pageTimings"), "onLoad");
            pageIndex[id] = pages.size();
            pages.push_back(std::move(page));
        }
    }

    std::vector<Item> items;
    items.reserve(entries.size());
    std::vector<Item*> loose;
    for (const json& entry : entries) {
        const uint64_t number = ++replay.entries;
        const std::string url = textOf(child(entry, "request"), "url");
        if (url.empty()) {
            ++replay.skipped;
            replay.problems.push_back("entry " + std::to_string(number) + " has no request URL; skipped");
            continue;
        }
        if (!isNetworkScheme(schemeOf(url))) {
            ++replay.skipped;
            continue;
        }
        items.push_back(makeItem(entry, number, url, client));
        const auto page = pageIndex.find(textOf(entry, "pageref"));
        if (page == pageIndex.end()) {
            loose.push_back(&items.back());
        } else {
            pages[page->second].items.push_back(&items.back());
        }
    }
    pages.erase(std::remove_if(pages.begin(), pages.end(), [](const Page& p) { return p.items.empty(); }),
                pages.end());
    for (Page& page : pages) {
        if (page.start) continue;
        for (const Item* item : page.items) {
            if (startsBefore(item->start, page.start)) page.start = item->start;
        }
    }
    for (Page& page : groupLoose(loose)) pages.push_back(std::move(page));
    std::stable_sort(pages.begin(), pages.end(),
                     [](const Page& a, const Page& b) { return startsBefore(a.start, b.start); });

    size_t number = 0;
    for (Page& page : pages) {
        ++number;
        emitPage(page, number <= UINT16_MAX ? static_cast<uint16_t>(number) : 0, replay.tables);
    }
    return true;
}

}  // namespace zub1sim

// Table script lines: JSON in, byte-exact result areas out.
//
// Every entry field is known by the name it has in zub/zub1rt.h, and its
// place and width are taken from that header, so the script can set exactly
// what the collector reads. Anything the layout cannot hold (an unknown name,
// a text longer than its field, a number outside its width, an entry mixing
// the HTTP and the media view) rejects the whole line: the collector must
// never see a table that the script did not describe.
#include "libzub1api/tablescript.h"

#include <array>
#include <climits>
#include <cstddef>
#include <cstring>
#include <vector>

#include <nlohmann/json.hpp>

#include "zub/zub1rt.h"

namespace zub1sim {
namespace {

using nlohmann::json;

enum class Kind { U32, I32, U16, Inline, Text };
enum class View { Common, Http, Media };

struct FieldDesc {
    const char* name;
    Kind kind;
    size_t offset;
    size_t width;
    View view;
};

#define ZUB_FIELD(name, kind, member, view)                                                  \
    FieldDesc                                                                                \
    {                                                                                        \
        name, Kind::kind, offsetof(ZUB_RESPONSE_TIME_DATA, member),                          \
            sizeof(static_cast<ZUB_RESPONSE_TIME_DATA*>(nullptr)->member), View::view        \
    }
#define COMMON(kind, member) ZUB_FIELD(#member, kind, member, Common)
#define SHARED(kind, member) ZUB_FIELD(#member, kind, detail.member, Common)
#define HTTP(kind, member) ZUB_FIELD(#member, kind, detail.view.http.member, Http)
#define MEDIA(kind, member) ZUB_FIELD(#member, kind, detail.view.media.member, Media)

// rdType is an inline text of four bytes: shorter codes are padded with NUL
// bytes, a four-character code has no terminator, as in the layout.
const FieldDesc ENTRY_FIELDS[] = {
    COMMON(U32, registeredFlag), COMMON(Inline, stampText),   COMMON(I32, intValue),
    COMMON(U32, ulongValue),     COMMON(Inline, textA),       COMMON(U16, ushortA),
    COMMON(U16, ushortB),        COMMON(Inline, textB),       COMMON(Inline, textC),
    COMMON(I32, intMetric1),     COMMON(I32, intMetric2),     COMMON(I32, intMetric3),
    COMMON(I32, intMetric4),     COMMON(I32, intMetric5),     COMMON(I32, longMetric1),
    COMMON(I32, longMetric2),    COMMON(I32, longMetric3),    COMMON(Inline, rdType),
    SHARED(Text, url),           SHARED(Text, detailText1),   SHARED(Text, detailText2),
    SHARED(Text, detailText3),   HTTP(Text, title),           HTTP(Inline, httpText),
    HTTP(I32, httpEntryType),    HTTP(I32, httpInt0),         HTTP(I32, httpInt1),
    HTTP(I32, httpInt2),         HTTP(I32, httpInt3),         HTTP(I32, httpInt4),
    HTTP(I32, httpInt5),         HTTP(I32, httpInt6),         HTTP(I32, httpInt7),
    HTTP(I32, httpInt8),         HTTP(I32, httpInt9),         HTTP(I32, httpInt10),
    HTTP(I32, httpInt11),        HTTP(I32, httpInt12),        MEDIA(Inline, mediaText),
    MEDIA(I32, mediaInt0),       MEDIA(I32, mediaInt1),       MEDIA(I32, mediaInt2),
};

#undef MEDIA
#undef HTTP
#undef SHARED
#undef COMMON
#undef ZUB_FIELD

using EntryBytes = std::array<unsigned char, ZUB_ENTRY_SIZE>;

// A pointer text waiting for its place behind the entries.
struct PendingText {
    size_t entry;
    size_t refOffset;
    std::string text;
};

const FieldDesc* findField(const std::string& name)
{
    for (const FieldDesc& field : ENTRY_FIELDS) {
        if (name == field.name) return &field;
    }
    return nullptr;
}

std::string quoted(const std::string& name) { return "\"" + name + "\""; }

// A value as the messages quote it. dump() recurses once per level of
// nesting, so a value nested deeper than any field could want (a line of
// a hundred thousand '[') is named by its kind instead of overflowing the
// stack; the depth is measured level by level, without recursion.
std::string shown(const json& value)
{
    std::vector<const json*> level{&value};
    for (int depth = 0; depth < 32 && !level.empty(); ++depth) {
        std::vector<const json*> next;
        for (const json* v : level) {
            if (v->is_structured()) {
                for (const json& child : *v) next.push_back(&child);
            }
        }
        level.swap(next);
    }
    if (!level.empty()) return std::string("an ") + value.type_name() + " nested too deeply to show";
    return value.dump(-1, ' ', false, json::error_handler_t::replace);
}

// Reads an integer in [min, max]. JSON fractions and integers beyond 64 bits
// are no integers here.
bool readInteger(const json& value, const std::string& name, long long min, long long max,
                 long long& out, std::string& error)
{
    if (value.is_number_unsigned()) {
        const auto u = value.get<unsigned long long>();
        if (u > static_cast<unsigned long long>(max)) {
            error = quoted(name) + " out of range: " + shown(value);
            return false;
        }
        out = static_cast<long long>(u);
        return true;
    }
    if (!value.is_number_integer()) {
        error = quoted(name) + " must be an integer, not " + shown(value);
        return false;
    }
    out = value.get<long long>();
    if (out < min || out > max) {
        error = quoted(name) + " out of range: " + shown(value);
        return false;
    }
    return true;
}

template <typename T>
void put(EntryBytes& entry, size_t offset, T value)
{
    std::memcpy(entry.data() + offset, &value, sizeof value);
}

bool storeField(const FieldDesc& field, const json& value, size_t index, EntryBytes& entry,
                std::vector<PendingText>& texts, std::string& error)
{
    long long number = 0;
    switch (field.kind) {
    case Kind::U32:
        if (!readInteger(value, field.name, 0, UINT32_MAX, number, error)) return false;
        put(entry, field.offset, static_cast<uint32_t>(number));
        return true;
    case Kind::I32:
        if (!readInteger(value, field.name, INT32_MIN, INT32_MAX, number, error)) return false;
        put(entry, field.offset, static_cast<int32_t>(number));
        return true;
    case Kind::U16:
        if (!readInteger(value, field.name, 0, UINT16_MAX, number, error)) return false;
        put(entry, field.offset, static_cast<uint16_t>(number));
        return true;
    case Kind::Inline: {
        if (!value.is_string()) {
            error = quoted(field.name) + " must be a string, not " + shown(value);
            return false;
        }
        const std::string& text = value.get_ref<const std::string&>();
        // A text exactly as long as its field fills it without terminator.
        if (text.size() > field.width) {
            error = "text too long for " + quoted(field.name) + " (" + std::to_string(text.size()) +
                    " bytes, room for " + std::to_string(field.width) + ")";
            return false;
        }
        std::memcpy(entry.data() + field.offset, text.data(), text.size());
        return true;
    }
    case Kind::Text:
        if (value.is_null()) return true;
        if (!value.is_string()) {
            error = quoted(field.name) + " must be a string or null, not " + shown(value);
            return false;
        }
        texts.push_back(PendingText{index, field.offset, value.get<std::string>()});
        return true;
    }
    return false;
}

bool parseEntry(const json& value, size_t index, EntryBytes& entry,
                std::vector<PendingText>& texts, std::string& error)
{
    const std::string where = " in entry " + std::to_string(index);
    if (!value.is_object()) {
        error = "entry " + std::to_string(index) + " must be an object";
        return false;
    }
    entry.fill(0);
    put(entry, offsetof(ZUB_RESPONSE_TIME_DATA, registeredFlag), uint32_t{1});
    const FieldDesc* httpField = nullptr;
    const FieldDesc* mediaField = nullptr;
    for (auto it = value.begin(); it != value.end(); ++it) {
        const FieldDesc* field = findField(it.key());
        if (field == nullptr) {
            error = "unknown field " + quoted(it.key()) + where;
            return false;
        }
        if (field->view == View::Http) httpField = field;
        if (field->view == View::Media) mediaField = field;
        if (!storeField(*field, it.value(), index, entry, texts, error)) {
            error += where;
            return false;
        }
    }
    if (httpField != nullptr && mediaField != nullptr) {
        error = "HTTP field " + quoted(httpField->name) + " and media field " +
                quoted(mediaField->name) + " both" + where;
        return false;
    }
    return true;
}

bool parseFilter(const json& value, ScriptTable& table, std::string& error)
{
    long long protocol = 0;
    long long service = 0;
    if (!value.is_array() || value.size() != 2) {
        error = "\"filter\" must be [protocol, service], not " + shown(value);
        return false;
    }
    if (!readInteger(value[0], "filter protocol", 0, UINT16_MAX, protocol, error) ||
        !readInteger(value[1], "filter service", 0, UINT16_MAX, service, error)) {
        return false;
    }
    table.protocol = static_cast<uint16_t>(protocol);
    table.service = static_cast<uint16_t>(service);
    return true;
}

#if ZUB_REF_IS_OFFSET
ZUB_REF makeRef(const char* record, const char* target) { return static_cast<ZUB_REF>(target - record); }
#else
ZUB_REF makeRef(const char*, char* target) { return target; }
#endif

// Lays the table out: header, entries, then the texts in entry order, each
// with its terminator. References follow the layout's rule (an offset from
// the record that holds it on 64-bit builds, a pointer on 32-bit ones).
bool buildArea(int32_t entryCount, const std::vector<EntryBytes>& entries,
               const std::vector<PendingText>& texts, ScriptTable& table, std::string& error)
{
    const size_t headerSize = sizeof(ZUB_RESPONSE_TIME_DATA_TABLE);
    size_t size = headerSize + entries.size() * ZUB_ENTRY_SIZE;
    for (const PendingText& text : texts) size += text.text.size() + 1;
    if (size > static_cast<size_t>(INT32_MAX)) {
        error = "table too large (" + std::to_string(size) + " bytes)";
        return false;
    }
    AreaPtr area(std::calloc(1, size));
    if (!area) {
        error = "out of memory for a table of " + std::to_string(size) + " bytes";
        return false;
    }
    char* base = static_cast<char*>(area.get());

    ZUB_RESPONSE_TIME_DATA_TABLE header;
    std::memset(&header, 0, sizeof header);
    header.entryCount = entryCount;
    if (!entries.empty()) header.entries = makeRef(base, base + headerSize);
    std::memcpy(base, &header, sizeof header);

    for (size_t i = 0; i < entries.size(); ++i) {
        std::memcpy(base + headerSize + i * ZUB_ENTRY_SIZE, entries[i].data(), ZUB_ENTRY_SIZE);
    }
    size_t pos = headerSize + entries.size() * ZUB_ENTRY_SIZE;
    for (const PendingText& text : texts) {
        char* entry = base + headerSize + text.entry * ZUB_ENTRY_SIZE;
        std::memcpy(base + pos, text.text.data(), text.text.size());
        const ZUB_REF ref = makeRef(entry, base + pos);
        std::memcpy(entry + text.refOffset, &ref, sizeof ref);
        pos += text.text.size() + 1;  // the terminator is already 0 (calloc)
    }
    table.area = std::move(area);
    table.size = size;
    return true;
}

}  // namespace

bool isSkippedLine(const std::string& line)
{
    const size_t first = line.find_first_not_of(" \t\r\n");
    return first == std::string::npos || line[first] == '#';
}

bool parseTableLine(const std::string& line, ScriptTable& table, std::string& error)
{
    json doc;
    try {
        doc = json::parse(line);
    } catch (const json::exception& e) {
        error = std::string("invalid JSON: ") + e.what();
        return false;
    }
    return buildTable(doc, table, error);
}

bool buildTable(const json& doc, ScriptTable& table, std::string& error)
{
    if (!doc.is_object()) {
        error = "a table line must be a JSON object";
        return false;
    }
    bool haveFilter = false;
    bool haveCount = false;
    long long count = 0;
    std::vector<EntryBytes> entries;
    std::vector<PendingText> texts;
    for (auto it = doc.begin(); it != doc.end(); ++it) {
        const std::string& key = it.key();
        if (key == "filter") {
            if (!parseFilter(it.value(), table, error)) return false;
            haveFilter = true;
        } else if (key == "entryCount") {
            if (!readInteger(it.value(), key, INT32_MIN, INT32_MAX, count, error)) return false;
            haveCount = true;
        } else if (key == "entries") {
            if (!it.value().is_array()) {
                error = "\"entries\" must be an array";
                return false;
            }
            entries.resize(it.value().size());
            for (size_t i = 0; i < entries.size(); ++i) {
                if (!parseEntry(it.value()[i], i, entries[i], texts, error)) return false;
            }
        } else {
            error = "unknown field " + quoted(key);
            return false;
        }
    }
    if (!haveFilter) {
        error = "missing \"filter\"";
        return false;
    }
    if (!haveCount) {
        count = static_cast<long long>(entries.size());
    } else if (count > static_cast<long long>(entries.size())) {
        error = "entryCount " + std::to_string(count) + " exceeds the " +
                std::to_string(entries.size()) + " entries given";
        return false;
    }
    if (entries.size() > static_cast<size_t>(INT32_MAX)) {
        error = "too many entries";
        return false;
    }
    return buildArea(static_cast<int32_t>(count), entries, texts, table, error);
}

}  // namespace zub1sim

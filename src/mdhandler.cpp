#include "mdhandler.h"

#include <cerrno>
#include <climits>
#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <memory>
#include <new>
#include <unistd.h>

#include "mcfg.h"
#include "mdwriter.h"
#include "mfmgr.h"
#include "murl.h"

static TRC1_CUB s_unit = TRC1_UNIT_INIT("mdhandler");

const char RDType_Defined[16][5] = {"NONE", "TCP ", "UDP ", "NONE", "HTTP", "MSVD", "REAL", "QTIM",
                                    "QOLB", "MSAU", "RLAU", "QOLC", "MALR", "PKTS", "CTXT", "STAT"};

namespace {

const char TYPE_HTTP[] = "HTTP";
const char NO_TITLE[] = "NO_TITLE_FOUND";
const char* const VIDEO_CODES[] = {"MSVD", "REAL", "QTIM"};
const char* const AUDIO_CODES[] = {"MSAU", "RLAU"};
// A GUID has at most this many characters; longer ones are cut.
const size_t GUID_MAX = 64;

// rdType is four characters without a terminator.
bool isType(const ZUB_RESPONSE_TIME_DATA* entry, const char* code)
{
    return memcmp(entry->rdType, code, sizeof(entry->rdType)) == 0;
}

const char* orNA(const char* text)
{
    return text != nullptr && text[0] != '\0' ? text : NA;
}

// Length of an inline text that may fill its field without a terminator,
// as a printf precision.
template <size_t N>
int fieldLength(const char (&field)[N])
{
    return static_cast<int>(strnlen(field, N));
}

// The piece of `text` (of `length` characters) from `start`, at most
// `limit` characters; empty when the text is shorter than `start`.
int cutLength(int length, int start, int limit)
{
    if (length <= start)
        return 0;
    return length - start < limit ? length - start : limit;
}

// Where the next piece of a record goes: at `used` while that lies inside
// the buffer, else at its end with no room, so that the piece is only
// measured.
char* pieceAt(char* buffer, size_t size, size_t used)
{
    return used < size ? buffer + used : buffer + size;
}

size_t roomAt(size_t size, size_t used)
{
    return used < size ? size - used : 0;
}

// One piece of a record, written as snprintf writes: at most `size` bytes,
// the last of them a NUL, while the length of the whole piece is counted
// on past the end, so that the caller can tell a cut piece and make room.
// Every column is a text or a decimal number; appending them directly
// instead of interpreting a format string per record is what keeps the
// formatting a small part of a record's cost next to its write.
class Piece {
public:
    Piece(char* buffer, size_t size)
        : m_at(buffer), m_room(size > 0 ? size - 1 : 0), m_terminate(size > 0), m_length(0)
    {
    }

    // `length` characters of `text` ("%.*s" for a text without a NUL in
    // them).
    Piece& text(const char* text, size_t length)
    {
        if (length <= m_room) {
            copy(m_at, text, length);
            m_at += length;
            m_room -= length;
        } else {
            // Cut: the rest is only counted.
            if (m_room > 0)
                memcpy(m_at, text, m_room);
            m_at += m_room;
            m_room = 0;
        }
        m_length += length;
        return *this;
    }
    // "%s"
    Piece& text(const char* text) { return this->text(text, strlen(text)); }
    // "%s" of a part of `whole`, or of "N/A" when the part is empty.
    Piece& textOrNA(const char* whole, Wq5UrlSplit::Span part)
    {
        if (part.length == 0)
            return text(NA, sizeof NA - 1);
        return text(whole + part.start, part.length);
    }
    // "%c"
    Piece& ch(char c)
    {
        if (m_room > 0) {
            *m_at++ = c;
            --m_room;
        }
        ++m_length;
        return *this;
    }
    // "%d", "%ld", "%u", "%lu"
    Piece& number(int64_t value)
    {
        if (value < 0) {
            ch('-');
            return digits(0 - static_cast<uint64_t>(value));
        }
        return digits(static_cast<uint64_t>(value));
    }

    // Terminates the piece; its whole length, or -1 when that is beyond
    // what an int holds (snprintf fails then too).
    int end()
    {
        if (m_terminate)
            *m_at = '\0';
        return m_length > static_cast<size_t>(INT_MAX) ? -1 : static_cast<int>(m_length);
    }

private:
    Piece& digits(uint64_t value)
    {
        // Two digits per division, from the end of a scratch buffer.
        static const char PAIRS[] =
            "00010203040506070809101112131415161718192021222324252627282930313233343536373839"
            "40414243444546474849505152535455565758596061626364656667686970717273747576777879"
            "8081828384858687888990919293949596979899";
        char scratch[20];
        char* first = scratch + sizeof scratch;
        while (value >= 100) {
            first -= 2;
            memcpy(first, PAIRS + 2 * (value % 100), 2);
            value /= 100;
        }
        if (value >= 10) {
            first -= 2;
            memcpy(first, PAIRS + 2 * value, 2);
        } else {
            *--first = static_cast<char>('0' + value);
        }
        const size_t count = static_cast<size_t>(scratch + sizeof scratch - first);
        if (count > m_room)
            return text(first, count);
        for (size_t i = 0; i < count; ++i)
            m_at[i] = first[i];
        m_at += count;
        m_room -= count;
        m_length += count;
        return *this;
    }

    // Most columns are a few characters long: copied with fixed-size
    // moves (two overlapping ones) instead of a call per column.
    static void copy(char* to, const char* from, size_t length)
    {
        if (length > 32) {
            memcpy(to, from, length);
        } else if (length >= 16) {
            memcpy(to, from, 16);
            memcpy(to + length - 16, from + length - 16, 16);
        } else if (length >= 8) {
            memcpy(to, from, 8);
            memcpy(to + length - 8, from + length - 8, 8);
        } else if (length >= 4) {
            memcpy(to, from, 4);
            memcpy(to + length - 4, from + length - 4, 4);
        } else {
            for (size_t i = 0; i < length; ++i)
                to[i] = from[i];
        }
    }

    char* m_at;
    size_t m_room;  // characters that still fit before the NUL
    bool m_terminate;
    size_t m_length;
};

}  // namespace

int typeLookup(const char* code)
{
    if (code == nullptr)
        return 0;
    for (int i = 4; i < 16; ++i)
        if (strncmp(code, RDType_Defined[i], 4) == 0)
            return i;
    return 0;
}

void replace(char* text, char from, char to)
{
    // A NUL `from` would find the terminator and run on past it.
    if (text == nullptr || from == '\0')
        return;
    for (char* at = strchr(text, from); at != nullptr; at = strchr(at + 1, from))
        *at = to;
}

void replace(char* text, size_t size, char from, char to)
{
    if (text == nullptr || from == '\0')
        return;
    for (size_t i = 0; i < size && text[i] != '\0'; ++i)
        if (text[i] == from)
            text[i] = to;
}

// ---------------------------------------------------------------- sampling

SampleControl::SampleControl(int logPercent, int factor, bool skipMode)
    : m_logPercent(logPercent), m_count(0), m_factor(factor), m_skipMode(skipMode), m_samplesActive(true), m_lock()
{
}

bool SampleControl::checkSampling()
{
    // m_logPercent never changes, so the common case needs no lock.
    if (m_logPercent >= 100)
        return true;

    scoped_lock lock(m_lock, true);
    ++m_count;
    if (m_skipMode) {
        if (m_count < m_factor) {
            m_samplesActive = true;
            return true;
        }
        m_count = 0;
        m_samplesActive = false;
        return false;
    }
    if (m_count == 1) {
        m_samplesActive = true;
        return true;
    }
    if (m_count >= m_factor)
        m_count = 0;
    m_samplesActive = false;
    return false;
}

bool SampleControl::logSamplesActive()
{
    scoped_lock lock(m_lock, true);
    return m_samplesActive;
}

// ------------------------------------------------------------ construction

DataHandler::DataHandler(FilterManager* manager)
    : m_httpSampler(nullptr), m_videoSampler(nullptr), m_audioSampler(nullptr), m_dataWriter(nullptr),
      m_version(), m_name(), m_manager(manager), m_logHttp(false), m_logHttpObj(false), m_guidMutex(),
      m_guidCounter(0), m_lastGuid(), m_logPercent(100), m_factor(100), m_skipMode(true), m_random(0),
      m_delimiter('^'), m_subChar('_'), m_processId(static_cast<unsigned long>(getpid())), m_clock(&time)
{
    static TRC1_EPB blk = TRC1_BLOCK_INIT(s_unit, "DataHandler::DataHandler");
    const int mask = trc1Mask(&blk);
    const bool entered = (mask & TRC_FLOW) != 0;
    if (entered)
        TRC1_Event(&blk, __LINE__, TRC1_ENTRY);

    if (m_manager != nullptr) {
        const Config* config = m_manager->getConfig();
        m_name = config->getName();
        m_version = config->getVersion();
        m_logHttp = config->logHttp();
        m_logHttpObj = config->logHttpObj();
        try {
            m_dataWriter = new DataWriter(config->getLogDir(), config->getLogSuffix(), config->getKeepDays(),
                                          config->getLogMaxSize());
            m_delimiter = config->getDelimiter();
            m_subChar = config->getSubChar();
            m_logPercent = config->getLogPercent();
            calculateLogPercent();
            m_httpSampler = new SampleControl(m_logPercent, m_factor, m_skipMode);
            m_videoSampler = new SampleControl(m_logPercent, m_factor, m_skipMode);
            m_audioSampler = new SampleControl(m_logPercent, m_factor, m_skipMode);
        } catch (...) {
            // The destructor does not run for a half-built handler.
            delete m_videoSampler;
            delete m_httpSampler;
            delete m_dataWriter;
            throw;
        }
    }

    srand(static_cast<unsigned>(time(nullptr)));
    m_random = rand();

    if (entered)
        TRC1_Event(&blk, __LINE__, TRC1_EXIT);
}

DataHandler::~DataHandler()
{
    delete m_dataWriter;
    delete m_httpSampler;
    delete m_videoSampler;
    delete m_audioSampler;
}

void DataHandler::calculateLogPercent()
{
    static TRC1_EPB blk = TRC1_BLOCK_INIT(s_unit, "DataHandler::calculateLogPercent");
    const int mask = trc1Mask(&blk);

    const int p = m_logPercent;
    if (p == 0) {
        m_logPercent = 100;
        return;
    }

    // The first row whose threshold the percentage reaches gives the group
    // length. From 45 % up the last record of each group is dropped (skip
    // mode); below, only the first record of each group passes.
    struct Row {
        int threshold;
        int factor;
        bool skipMode;
    };
    static const Row rows[] = {
        {99, 100, true}, {98, 50, true}, {97, 34, true}, {96, 25, true}, {95, 20, true}, {90, 10, true},
        {85, 7, true},   {80, 5, true},  {70, 4, true},  {60, 3, true},  {45, 2, true},  {30, 3, false},
        {25, 4, false},  {20, 5, false}, {15, 6, false}, {10, 10, false}, {7, 14, false}, {6, 16, false},
        {5, 20, false},  {4, 25, false}, {3, 33, false}, {2, 50, false}, {1, 100, false},
    };
    m_skipMode = false;  // a percentage below 1 matches no row: keep mode, factor as it was
    for (const Row& row : rows) {
        if (p >= row.threshold) {
            m_factor = row.factor;
            m_skipMode = row.skipMode;
            break;
        }
    }

    if (mask & TRC_DETAIL)
        TRC1_Printf(&blk, __LINE__, "log pct = %d factor = %d skipMode = %s", p, m_factor,
                    m_skipMode ? "true" : "false");
}

// -------------------------------------------------------------------- GUID

std::string DataHandler::generateGuid()
{
    const time_t now = m_clock(nullptr);
    char text[GUID_MAX + 1] = {0};

    scoped_lock lock(m_guidMutex, true);
    const uint32_t counter = m_guidCounter++;
    snprintf(text, sizeof(text), "%lx%llx%x%08x%s", m_processId, static_cast<unsigned long long>(now),
             static_cast<unsigned>(m_random), static_cast<unsigned>(counter), m_name.c_str());
    m_lastGuid = text;
    return m_lastGuid;
}

std::string DataHandler::getGuid()
{
    std::string last;
    {
        scoped_lock lock(m_guidMutex, true);
        last = m_lastGuid;
    }
    if (!last.empty())
        return last;
    return generateGuid();
}

// ------------------------------------------------------------ record pieces

int DataHandler::addHeader(char* buffer, size_t size, const char* tag, const std::string& guid)
{
    if (buffer == nullptr || tag == nullptr)
        return 0;
    const char d = m_delimiter;
    // "<%s>%s%c%d%c0%c%s%c%s%c"
    return Piece(buffer, size)
        .ch('<').text(tag).ch('>')
        .text(m_version.c_str()).ch(d)
        .number(WEBMEDIA_APPL_ID).ch(d)
        .ch('0').ch(d)
        .text(m_name.c_str()).ch(d)
        .text(guid.c_str()).ch(d)
        .end();
}

int DataHandler::addCommon(char* buffer, size_t size, ZUB_RESPONSE_TIME_DATA* entry)
{
    if (buffer == nullptr || entry == nullptr)
        return 0;
    const char d = m_delimiter;
    // Columns 2 and 3 are cut from the stamp: up to 10 characters from
    // position 4 and up to 8 from position 15; a short stamp gives what
    // is there.
    const int stampLength = fieldLength(entry->stampText);
    // "%lu%c%.*s%c%.*s%c%d%c%.*s%c%.*s%c%u%c%.*s%c%u%c%d%c%d%c%d%c%d%c%d%c%ld%c%ld%c%ld%c"
    return Piece(buffer, size)
        .number(entry->ulongValue).ch(d)
        .text(entry->stampText + 4, static_cast<size_t>(cutLength(stampLength, 4, 10))).ch(d)
        .text(entry->stampText + 15, static_cast<size_t>(cutLength(stampLength, 15, 8))).ch(d)
        .number(entry->intValue).ch(d)
        .text(entry->textA, static_cast<size_t>(fieldLength(entry->textA))).ch(d)
        .text(entry->textB, static_cast<size_t>(fieldLength(entry->textB))).ch(d)
        .number(entry->ushortA).ch(d)
        .text(entry->textC, static_cast<size_t>(fieldLength(entry->textC))).ch(d)
        .number(entry->ushortB).ch(d)
        .number(entry->intMetric1).ch(d)
        .number(entry->intMetric2).ch(d)
        .number(entry->intMetric3).ch(d)
        .number(entry->intMetric4).ch(d)
        .number(entry->intMetric5).ch(d)
        .number(entry->longMetric1).ch(d)
        .number(entry->longMetric2).ch(d)
        .number(entry->longMetric3).ch(d)
        .end();
}

int DataHandler::addHttpMain(char* buffer, size_t size, ZUB_RESPONSE_TIME_DATA* entry)
{
    if (buffer == nullptr || entry == nullptr)
        return 0;
    ResponseTimeDetail& detail = entry->detail;
    ZUB_HTTP_DETAIL& http = detail.view.http;
    char* url = zubText(entry, detail.url);
    char* text1 = zubText(entry, detail.detailText1);
    char* text2 = zubText(entry, detail.detailText2);
    char* text3 = zubText(entry, detail.detailText3);
    char* title = zubText(entry, http.title);

    const char d = m_delimiter;
    replace(url, d, m_subChar);
    replace(text1, d, m_subChar);
    replace(text2, d, m_subChar);
    replace(text3, d, m_subChar);
    replace(http.httpText, sizeof(http.httpText), d, m_subChar);
    replace(title, d, m_subChar);

    // The parts are read straight out of the URL text; it outlives the
    // record.
    const size_t urlLength = url != nullptr ? strlen(url) : 0;
    const Wq5UrlSplit parts = splitUrl(url != nullptr ? url : "", urlLength);

    // Compared after the substitution: when '_' is the delimiter, the
    // marker no longer reads NO_TITLE_FOUND and is written as a title.
    const char* titleText = orNA(title);
    if (strcmp(titleText, NO_TITLE) == 0)
        titleText = NA;

    const int httpTextLength = fieldLength(http.httpText);

    // "%s%c%s%c%s%c%s%c%s%c%d%c%d%c%d%c%d%c%d%c%d%c%d%c%d%c%d%c%d%c%d%c%d%c%s%c%s%c%s%c%s%c%s%c%s%c%d"
    Piece piece(buffer, size);
    piece.textOrNA(url, parts.partialForm).ch(d)
        .text(orNA(text1)).ch(d)
        .text(orNA(text2)).ch(d)
        .text(orNA(text3)).ch(d);
    if (httpTextLength > 0)
        piece.text(http.httpText, static_cast<size_t>(httpTextLength)).ch(d);
    else
        piece.text(NA).ch(d);
    return piece.number(http.httpInt1).ch(d)
        .number(http.httpInt2).ch(d)
        .number(http.httpInt3).ch(d)
        .number(http.httpInt4).ch(d)
        .number(http.httpInt8).ch(d)
        .number(http.httpInt9).ch(d)
        .number(http.httpInt10).ch(d)
        .number(http.httpInt11).ch(d)
        .number(http.httpInt12).ch(d)
        .number(http.httpInt7).ch(d)
        .number(http.httpInt6).ch(d)
        .number(http.httpInt5).ch(d)
        .textOrNA(url, parts.host).ch(d)
        .textOrNA(url, parts.path).ch(d)
        .textOrNA(url, parts.file).ch(d)
        .textOrNA(url, parts.query).ch(d)
        .textOrNA(url, parts.ref).ch(d)
        .text(titleText).ch(d)
        .number(http.httpInt0)
        .end();
}

int DataHandler::addHttpObj(char* buffer, size_t size, ZUB_RESPONSE_TIME_DATA* entry)
{
    return addHttpMain(buffer, size, entry);
}

int DataHandler::addHttpSummary(char* buffer, size_t size, ZUB_RESPONSE_TIME_DATA* entry)
{
    return addHttpMain(buffer, size, entry);
}

int DataHandler::addMedia(char* buffer, size_t size, ZUB_RESPONSE_TIME_DATA* entry)
{
    if (buffer == nullptr || entry == nullptr)
        return 0;
    const ResponseTimeDetail& detail = entry->detail;
    const ZUB_MEDIA_DETAIL& media = detail.view.media;
    const char d = m_delimiter;
    const int mediaTextLength = fieldLength(media.mediaText);

    // "%d%c%s%c%s%c%s%c%s%c%s%c%d%c%d%c%d"
    Piece piece(buffer, size);
    piece.number(typeLookup(entry->rdType)).ch(d)
        .text(orNA(zubText(entry, detail.url))).ch(d)
        .text(orNA(zubText(entry, detail.detailText1))).ch(d)
        .text(orNA(zubText(entry, detail.detailText2))).ch(d)
        .text(orNA(zubText(entry, detail.detailText3))).ch(d);
    if (mediaTextLength > 0)
        piece.text(media.mediaText, static_cast<size_t>(mediaTextLength)).ch(d);
    else
        piece.text(NA).ch(d);
    return piece.number(media.mediaInt0).ch(d)
        .number(media.mediaInt1).ch(d)
        .number(media.mediaInt2)
        .end();
}

int DataHandler::addFooter(char* buffer, size_t size, const char* tag)
{
    if (buffer == nullptr || tag == nullptr)
        return 0;
    return Piece(buffer, size).text("</", 2).text(tag).ch('>').ch('\n').end();
}

// ------------------------------------------------------------ whole records

int64_t DataHandler::formatRecord(char* buffer, size_t size, const char* tag, const std::string& guid,
                                  ZUB_RESPONSE_TIME_DATA* entry, FamilyPart family)
{
    size_t used = 0;
    int n = addHeader(buffer, size, tag, guid);
    if (n < 0)
        return -1;
    used += static_cast<size_t>(n);
    if ((n = addCommon(pieceAt(buffer, size, used), roomAt(size, used), entry)) < 0)
        return -1;
    used += static_cast<size_t>(n);
    if ((n = (this->*family)(pieceAt(buffer, size, used), roomAt(size, used), entry)) < 0)
        return -1;
    used += static_cast<size_t>(n);
    if ((n = addFooter(pieceAt(buffer, size, used), roomAt(size, used), tag)) < 0)
        return -1;
    used += static_cast<size_t>(n);
    return static_cast<int64_t>(used);
}

void DataHandler::emitRecord(TRC1_EPB* blk, int mask, char* buffer, FamilyPart family, const char* tag,
                             const std::string& guid, ZUB_RESPONSE_TIME_DATA* entry)
{
    const int64_t length = formatRecord(buffer, RECORD_BUFFER_SIZE, tag, guid, entry, family);
    if (length >= 0 && static_cast<uint64_t>(length) < RECORD_BUFFER_SIZE) {
        writeRecord(blk, mask, buffer, static_cast<size_t>(length));
        return;
    }

    // Too long for the call's buffer (texts of the library have no bound):
    // formatting is repeatable, so build the record again, whole, in a
    // buffer of its exact size rather than cut it.
    if (length < 0 || static_cast<uint64_t>(length) >= SIZE_MAX) {
        if (mask & TRC_ERROR)
            TRC1_Printf(blk, __LINE__, "Record with tag <%s> could not be formatted.", tag);
        return;
    }
    const size_t size = static_cast<size_t>(length) + 1;
    std::unique_ptr<char[]> large(new (std::nothrow) char[size]);
    if (!large || formatRecord(large.get(), size, tag, guid, entry, family) != length) {
        if (mask & TRC_ERROR)
            TRC1_Printf(blk, __LINE__, "Record of <%lld> bytes with tag <%s> dropped.",
                        static_cast<long long>(length), tag);
        return;
    }
    writeRecord(blk, mask, large.get(), static_cast<size_t>(length));
}

void DataHandler::writeRecord(TRC1_EPB* blk, int mask, const char* record, size_t length)
{
    // The writer counts the dropped record and takes off whatever part of
    // it reached the file; the reason is reported here.
    DataWriterLock lock(*m_dataWriter);
    if (lock.writeRecord(record, length))
        return;
    const int error = errno;
    if (!(mask & TRC_ERROR))
        return;
    if (lock.getStream() == nullptr)
        TRC1_Printf(blk, __LINE__, "Failed to open log file.");
    else
        TRC1_Printf(blk, __LINE__, "Write to log file failed %d", error);
}

// ------------------------------------------------------------ table walks

bool DataHandler::stillRegistered(ZUB_RESPONSE_TIME_DATA_TABLE* table)
{
    // A handler built without a manager has no writer or samplers.
    if (m_dataWriter == nullptr)
        return false;
    // A table without an entry area has nothing to read, not even the flag.
    ZUB_RESPONSE_TIME_DATA* first = zubEntry(table, 0);
    if (first == nullptr)
        return false;
    if (first->registeredFlag == 0) {
        m_manager->disconnect();
        return false;
    }
    return true;
}

void DataHandler::processHttp(ZUB_RESPONSE_TIME_DATA_TABLE* table)
{
    static TRC1_EPB blk = TRC1_BLOCK_INIT(s_unit, "DataHandler::processHttp");
    const int mask = trc1Mask(&blk);

    if (mask & TRC_DETAIL)
        TRC1_Printf(&blk, __LINE__, "processing table <%p>", static_cast<void*>(table));
    if (table == nullptr)
        return;
    if (mask & TRC_DETAIL)
        TRC1_Printf(&blk, __LINE__, "  total entries <%d>", static_cast<int>(table->entryCount));
    if (!stillRegistered(table))
        return;

    char buffer[RECORD_BUFFER_SIZE];
    // The GUID of the records; an object record carries that of the page
    // entry before it in this table. Tables of one kind arrive on several
    // threads at once, so the handler's last GUID and its page sampler's
    // latest decision may by then belong to another thread's page: they
    // are used only for objects with no page before them in their table
    // (and the decision also when that page was not sampled).
    std::string guid;
    bool pageSeen = false;
    bool pageSampled = false;
    bool pageActive = true;

    const int32_t count = table->entryCount;
    for (int32_t i = 0; i < count; ++i) {
        ZUB_RESPONSE_TIME_DATA* entry = zubEntry(table, i);
        if (!isType(entry, TYPE_HTTP))
            continue;
        const int entryType = entry->detail.view.http.httpEntryType;
        if (mask & TRC_DETAIL)
            TRC1_Printf(&blk, __LINE__, "  processing entry <%d> type <%d>", static_cast<int>(i), entryType);

        // The GUID is made or fetched before the switches and the sampler
        // are consulted, so every page moves the GUID counter on.
        const char* tag;
        if (entryType == 1) {
            guid = generateGuid();
            pageSeen = true;
            pageSampled = false;
            if (!m_logHttp)
                continue;
            pageActive = m_httpSampler->checkSampling();
            pageSampled = true;
            if (!pageActive)
                continue;
            tag = TAG_HTTPPAGE;
        } else if (entryType == 2) {
            if (!pageSeen)
                guid = getGuid();
            if (!m_logHttpObj)
                continue;
            const bool active = pageSampled ? pageActive : m_httpSampler->logSamplesActive();
            if (!active)
                continue;
            tag = TAG_HTTPOBJ;
        } else {
            continue;
        }

        if (mask & TRC_DETAIL) {
            TRC1_Printf(&blk, __LINE__, "    writing <%d> tag <%s>", static_cast<int>(i), tag);
            // Shows the URL before the delimiter in it is substituted.
            TRC1_Printf(&blk, __LINE__, "    url <%s>", orNA(zubText(entry, entry->detail.url)));
        }
        emitRecord(&blk, mask, buffer, &DataHandler::addHttpMain, tag, guid, entry);
    }
}

void DataHandler::processVideo(ZUB_RESPONSE_TIME_DATA_TABLE* table)
{
    static TRC1_EPB blk = TRC1_BLOCK_INIT(s_unit, "DataHandler::processVideo");
    processMedia(&blk, trc1Mask(&blk), table, m_videoSampler, VIDEO_CODES,
                 static_cast<int>(sizeof(VIDEO_CODES) / sizeof(VIDEO_CODES[0])), TAG_VIDEO);
}

void DataHandler::processAudio(ZUB_RESPONSE_TIME_DATA_TABLE* table)
{
    static TRC1_EPB blk = TRC1_BLOCK_INIT(s_unit, "DataHandler::processAudio");
    processMedia(&blk, trc1Mask(&blk), table, m_audioSampler, AUDIO_CODES,
                 static_cast<int>(sizeof(AUDIO_CODES) / sizeof(AUDIO_CODES[0])), TAG_AUDIO);
}

void DataHandler::processMedia(TRC1_EPB* blk, int mask, ZUB_RESPONSE_TIME_DATA_TABLE* table, SampleControl* sampler,
                               const char* const* codes, int codeCount, const char* tag)
{
    if (mask & TRC_DETAIL)
        TRC1_Printf(blk, __LINE__, "processing table <%p>", static_cast<void*>(table));
    if (table == nullptr || !stillRegistered(table))
        return;

    char buffer[RECORD_BUFFER_SIZE];
    std::string guid;
    const int32_t count = table->entryCount;
    for (int32_t i = 0; i < count; ++i) {
        ZUB_RESPONSE_TIME_DATA* entry = zubEntry(table, i);
        // Every entry counts for the sampler, whatever its type.
        if (!sampler->checkSampling())
            continue;
        bool accepted = false;
        for (int c = 0; c < codeCount && !accepted; ++c)
            accepted = isType(entry, codes[c]);
        if (!accepted)
            continue;

        ResponseTimeDetail& detail = entry->detail;
        replace(zubText(entry, detail.url), m_delimiter, m_subChar);
        replace(zubText(entry, detail.detailText1), m_delimiter, m_subChar);
        replace(zubText(entry, detail.detailText2), m_delimiter, m_subChar);
        replace(zubText(entry, detail.detailText3), m_delimiter, m_subChar);
        replace(detail.view.media.mediaText, sizeof(detail.view.media.mediaText), m_delimiter, m_subChar);

        guid = generateGuid();
        emitRecord(blk, mask, buffer, &DataHandler::addMedia, tag, guid, entry);
    }
}

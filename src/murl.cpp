#include "murl.h"

#include <climits>
#include <cstdlib>
#include <cstring>

namespace {

const std::string::size_type NONE = std::string::npos;

// White space as the C locale knows it; bytes of 0x80 and above never are.
bool isBlank(char c)
{
    return c == ' ' || c == '\t' || c == '\n' || c == '\v' || c == '\f' || c == '\r';
}

// The leading number of `text` as atoi reads it (blanks, sign, digits; 0
// when there are none). atoi leaves an out-of-range value undefined; here
// it saturates at the int limits.
int portNumber(const std::string& text)
{
    long value = std::strtol(text.c_str(), nullptr, 10);
    if (value > INT_MAX)
        return INT_MAX;
    if (value < INT_MIN)
        return INT_MIN;
    return static_cast<int>(value);
}

// The first `c` at or after `from` in the text, or NONE.
std::string::size_type find(const char* text, size_t length, char c, size_t from)
{
    if (from >= length)
        return NONE;
    const void* at = memchr(text + from, c, length - from);
    return at == nullptr ? NONE : static_cast<size_t>(static_cast<const char*>(at) - text);
}

Wq5UrlSplit::Span span(size_t start, size_t end)
{
    return Wq5UrlSplit::Span{start, end - start};
}

}  // namespace

Wq5Url::Wq5Url(const std::string& url) : m_url(url), m_port(-1)
{
    parse(url);
}

Wq5Url::Wq5Url(const char* url) : m_port(-1)
{
    if (url == nullptr)
        return;
    m_url = url;
    parse(m_url);
}

Wq5Url::~Wq5Url() {}

Wq5UrlSplit splitUrl(const char* text, size_t length)
{
    const std::string::size_type end = length;
    Wq5UrlSplit split = {};

    // The partial form keeps the raw text, leading blanks included.
    const std::string::size_type firstQuery = find(text, length, '?', 0);
    split.partialForm = span(0, firstQuery == NONE ? end : firstQuery);

    std::string::size_type cursor = 0;
    while (cursor < end && isBlank(text[cursor]))
        ++cursor;

    // The first ':' anywhere in the rest ends the scheme, even one that
    // belongs to a port or a query.
    const std::string::size_type schemeColon = find(text, length, ':', cursor);
    if (schemeColon != NONE)
        cursor = schemeColon + 1;

    std::string::size_type authority = NONE;
    std::string::size_type pathStart = NONE;
    if (end - cursor >= 2 && text[cursor] == '/' && text[cursor + 1] == '/') {
        authority = cursor;
        cursor += 2;
        // Any later '/' starts the path, even one inside the query.
        const std::string::size_type slash = find(text, length, '/', cursor);
        if (slash != NONE) {
            pathStart = slash;
            cursor = slash + 1;
        }
    } else {
        pathStart = cursor;
    }

    std::string::size_type queryMark = find(text, length, '?', cursor);
    if (queryMark != NONE)
        cursor = queryMark + 1;
    // A '#' counts only after the '?' (or after the path start when there
    // is no '?'); one in front of the '?' stays in the path.
    std::string::size_type refMark = find(text, length, '#', cursor);
    if (refMark == NONE)
        refMark = end;
    if (queryMark == NONE)
        queryMark = refMark;
    if (pathStart == NONE)
        pathStart = queryMark;

    // The last ':' between the "//" and the path start, so a user:password
    // in front of the host yields the user as host.
    std::string::size_type portColon = NONE;
    if (authority != NONE) {
        for (std::string::size_type at = pathStart; at > authority + 1; --at) {
            if (text[at - 1] == ':') {
                portColon = at - 1;
                break;
            }
        }
    }

    std::string::size_type fileStart = queryMark;
    while (fileStart > pathStart && text[fileStart - 1] != '/')
        --fileStart;

    if (schemeColon != NONE)
        split.scheme = span(0, schemeColon);
    if (authority != NONE)
        split.host = span(authority + 2, portColon != NONE ? portColon : pathStart);
    split.path = span(pathStart, queryMark);
    split.file = span(fileStart, queryMark);
    if (queryMark != refMark)
        split.query = span(queryMark + 1, refMark);
    if (refMark != end)
        split.ref = span(refMark + 1, end);
    if (portColon != NONE) {
        split.port = span(portColon + 1, pathStart);
        split.hasPort = true;
    }
    return split;
}

void Wq5Url::parse(const std::string& text)
{
    const Wq5UrlSplit split = splitUrl(text.data(), text.size());
    m_partialForm.assign(text, split.partialForm.start, split.partialForm.length);
    m_scheme.assign(text, split.scheme.start, split.scheme.length);
    m_host.assign(text, split.host.start, split.host.length);
    m_path.assign(text, split.path.start, split.path.length);
    m_file.assign(text, split.file.start, split.file.length);
    m_query.assign(text, split.query.start, split.query.length);
    m_ref.assign(text, split.ref.start, split.ref.length);
    if (split.hasPort)
        m_port = portNumber(text.substr(split.port.start, split.port.length));
}

#include "murl.h"

#include <climits>
#include <cstdlib>

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

void Wq5Url::parse(const std::string& text)
{
    const std::string::size_type end = text.size();

    // The partial form keeps the raw text, leading blanks included.
    m_partialForm = text.substr(0, text.find('?'));

    std::string::size_type cursor = 0;
    while (cursor < end && isBlank(text[cursor]))
        ++cursor;

    // The first ':' anywhere in the rest ends the scheme, even one that
    // belongs to a port or a query.
    const std::string::size_type schemeColon = text.find(':', cursor);
    if (schemeColon != NONE)
        cursor = schemeColon + 1;

    std::string::size_type authority = NONE;
    std::string::size_type pathStart = NONE;
    if (end - cursor >= 2 && text[cursor] == '/' && text[cursor + 1] == '/') {
        authority = cursor;
        cursor += 2;
        // Any later '/' starts the path, even one inside the query.
        const std::string::size_type slash = text.find('/', cursor);
        if (slash != NONE) {
            pathStart = slash;
            cursor = slash + 1;
        }
    } else {
        pathStart = cursor;
    }

    std::string::size_type queryMark = text.find('?', cursor);
    if (queryMark != NONE)
        cursor = queryMark + 1;
    // A '#' counts only after the '?' (or after the path start when there
    // is no '?'); one in front of the '?' stays in the path.
    std::string::size_type refMark = text.find('#', cursor);
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
        m_scheme = text.substr(0, schemeColon);
    if (authority != NONE) {
        const std::string::size_type hostEnd = portColon != NONE ? portColon : pathStart;
        m_host = text.substr(authority + 2, hostEnd - (authority + 2));
    }
    if (pathStart != queryMark)
        m_path = text.substr(pathStart, queryMark - pathStart);
    if (fileStart != queryMark)
        m_file = text.substr(fileStart, queryMark - fileStart);
    if (queryMark != refMark)
        m_query = text.substr(queryMark + 1, refMark - (queryMark + 1));
    if (refMark != end)
        m_ref = text.substr(refMark + 1);
    if (portColon != NONE)
        m_port = portNumber(text.substr(portColon + 1, pathStart - (portColon + 1)));
}

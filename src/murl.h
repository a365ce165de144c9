// Splits a URL text into the parts that the HTTP records carry.
//
// The split is a fixed sequence of character searches, not a URL grammar:
// it validates nothing and reports no errors, and its results on unusual
// input (a ':' inside the query, a '/' inside the query of a URL without a
// path, ...) are part of the record format. An absent part is an empty
// string; an absent port is -1. The object owns copies of everything it
// keeps and holds no pointer into the text it was built from.
#ifndef WQ5_MURL_H
#define WQ5_MURL_H

#include <cstddef>
#include <string>

// Where the parts lie within a URL text of `length` bytes: the split that
// Wq5Url copies its parts from, for a caller that only reads the parts
// while the text lives (the record formatting, without a copy per part).
// An absent part has length 0; `hasPort` tells whether there is a port
// text (`port`, to be read as atoi does).
struct Wq5UrlSplit {
    struct Span {
        size_t start;
        size_t length;
    };
    Span partialForm, scheme, host, path, file, query, ref, port;
    bool hasPort;
};
Wq5UrlSplit splitUrl(const char* text, size_t length);

class Wq5Url {
public:
    explicit Wq5Url(const std::string& url);
    // A null `url` gives empty parts and port -1.
    explicit Wq5Url(const char* url);
    ~Wq5Url();

    const std::string& getHost() const { return m_host; }
    // The last path segment.
    const std::string& getFile() const { return m_file; }
    // The path with its leading '/'.
    const std::string& getPath() const { return m_path; }
    // The text after '?' and before '#'.
    const std::string& getQuery() const { return m_query; }
    // The text after '#'.
    const std::string& getRef() const { return m_ref; }
    // The raw text up to, not including, its first '?'.
    const std::string& getPartialForm() const { return m_partialForm; }

private:
    // Fills the parts from `text` (splitUrl); runs once, on an object whose
    // parts are still empty.
    void parse(const std::string& text);

    std::string m_url;
    std::string m_host;
    std::string m_file;
    std::string m_path;
    std::string m_scheme;
    int m_port;
    std::string m_query;
    std::string m_ref;
    std::string m_partialForm;

    friend struct Wq5UrlTestAccess;
};

#endif

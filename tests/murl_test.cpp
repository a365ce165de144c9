// URL decomposition: the character-search rules, row by row.
#include <gtest/gtest.h>

#include <string>

#include "src/murl.h"

// Reaches the two parts that have no getter.
struct Wq5UrlTestAccess {
    static const std::string& scheme(const Wq5Url& url) { return url.m_scheme; }
    static int port(const Wq5Url& url) { return url.m_port; }
    static const std::string& url(const Wq5Url& url) { return url.m_url; }
};

namespace {

struct UrlCase {
    const char* input;
    const char* scheme;
    const char* host;
    int port;
    const char* path;
    const char* file;
    const char* query;
    const char* ref;
    const char* partialForm;
};

const UrlCase URL_CASES[] = {
    // input                                scheme           host       port  path            file      query  ref     partial form
    {"proto://host:8080/dir/file?q#ref", "proto", "host", 8080, "/dir/file", "file", "q", "ref", "proto://host:8080/dir/file"},
    {"proto://host/dir/", "proto", "host", -1, "/dir/", "", "", "", "proto://host/dir/"},
    {"proto://host", "proto", "host", -1, "", "", "", "", "proto://host"},
    {"proto://host:8080", "proto", "host", 8080, "", "", "", "", "proto://host:8080"},
    {"proto://host?x=1", "proto", "host", -1, "", "", "x=1", "", "proto://host"},
    // A '/' in the query of a URL without a path starts the path.
    {"proto://host?x=/y", "proto", "host?x=", -1, "/y", "y", "", "", "proto://host"},
    // A '#' in front of the first '?' stays in the path.
    {"proto://host/p#frag?x", "proto", "host", -1, "/p#frag", "p#frag", "x", "", "proto://host/p#frag"},
    {"proto://host/p#frag", "proto", "host", -1, "/p", "p", "", "frag", "proto://host/p#frag"},
    {"host/dir/file", "", "", -1, "host/dir/file", "file", "", "", "host/dir/file"},
    // Without "//" the first ':' anywhere ends the scheme.
    {"host:81/dir/file", "host", "", -1, "81/dir/file", "file", "", "", "host:81/dir/file"},
    {"/dir/file?a=b:9", "/dir/file?a=b", "", -1, "9", "9", "", "", "/dir/file"},
    {"/dir/file?x", "", "", -1, "/dir/file", "file", "x", "", "/dir/file"},
    {"proto:/dir/file", "proto", "", -1, "/dir/file", "file", "", "", "proto:/dir/file"},
    // The last ':' between "//" and the path is the port colon.
    {"proto://u:p@h/x", "proto", "u", 0, "/x", "x", "", "", "proto://u:p@h/x"},
    // Leading blanks are skipped by the searches but kept in the partial form.
    {"  proto://host/a", "  proto", "host", -1, "/a", "a", "", "", "  proto://host/a"},
    {"\t\r\n\v\fproto://host/a", "\t\r\n\v\fproto", "host", -1, "/a", "a", "", "", "\t\r\n\v\fproto://host/a"},
    // Trailing blanks stay.
    {"proto://host/a ", "proto", "host", -1, "/a ", "a ", "", "", "proto://host/a "},
    {"", "", "", -1, "", "", "", "", ""},
    // A port that is no number reads 0; atoi stops at the first non-digit.
    {"proto://host:http/a", "proto", "host", 0, "/a", "a", "", "", "proto://host:http/a"},
    {"proto://host:-12/a", "proto", "host", -12, "/a", "a", "", "", "proto://host:-12/a"},
    {"proto://host:99999999999/a", "proto", "host", 2147483647, "/a", "a", "", "", "proto://host:99999999999/a"},
    {"proto://host:/a", "proto", "host", 0, "/a", "a", "", "", "proto://host:/a"},
    // Query and reference at the very end.
    {"proto://host/a?", "proto", "host", -1, "/a", "a", "", "", "proto://host/a"},
    {"proto://host/a?q#", "proto", "host", -1, "/a", "a", "q", "", "proto://host/a"},
    {"proto://host/a#r#s", "proto", "host", -1, "/a", "a", "", "r#s", "proto://host/a#r#s"},
    {"proto://host/a?b?c#d", "proto", "host", -1, "/a", "a", "b?c", "d", "proto://host/a"},
    // A path ending in '/' has no file.
    {"proto://host/?q", "proto", "host", -1, "/", "", "q", "", "proto://host/"},
    // Only "//" at the cursor makes an authority.
    {"proto:/ /host", "proto", "", -1, "/ /host", "host", "", "", "proto:/ /host"},
    {"//host/a", "", "host", -1, "/a", "a", "", "", "//host/a"},
    {"proto:", "proto", "", -1, "", "", "", "", "proto:"},
    {"proto://", "proto", "", -1, "", "", "", "", "proto://"},
    {"?only", "", "", -1, "", "", "only", "", ""},
    // Without a '?' the '#' is searched from the path start on.
    {"#only", "", "", -1, "", "", "", "only", "#only"},
    // Bytes of 0x80 and above are no white space.
    {"\xa0proto://h/a", "\xa0proto", "h", -1, "/a", "a", "", "", "\xa0proto://h/a"},
};

void expectParts(const Wq5Url& url, const UrlCase& c)
{
    SCOPED_TRACE(std::string("input <") + c.input + ">");
    EXPECT_EQ(c.scheme, Wq5UrlTestAccess::scheme(url));
    EXPECT_EQ(c.host, url.getHost());
    EXPECT_EQ(c.port, Wq5UrlTestAccess::port(url));
    EXPECT_EQ(c.path, url.getPath());
    EXPECT_EQ(c.file, url.getFile());
    EXPECT_EQ(c.query, url.getQuery());
    EXPECT_EQ(c.ref, url.getRef());
    EXPECT_EQ(c.partialForm, url.getPartialForm());
    EXPECT_EQ(c.input, Wq5UrlTestAccess::url(url));
}

TEST(Wq5Url, DecomposesEveryCaseFromATextPointer)
{
    for (const UrlCase& c : URL_CASES)
        expectParts(Wq5Url(c.input), c);
}

TEST(Wq5Url, DecomposesEveryCaseFromAString)
{
    for (const UrlCase& c : URL_CASES)
        expectParts(Wq5Url(std::string(c.input)), c);
}

TEST(Wq5Url, NullTextGivesEmptyPartsAndNoPort)
{
    const UrlCase empty = {"", "", "", -1, "", "", "", "", ""};
    expectParts(Wq5Url(static_cast<const char*>(nullptr)), empty);
}

TEST(Wq5Url, KeepsNoPointerIntoItsText)
{
    char text[] = "proto://host:81/dir/file?q#r";
    Wq5Url url(text);
    memset(text, 'x', sizeof(text) - 1);
    EXPECT_EQ("host", url.getHost());
    EXPECT_EQ("/dir/file", url.getPath());
    EXPECT_EQ("proto://host:81/dir/file", url.getPartialForm());
}

TEST(Wq5Url, TextWithEmbeddedNulIsTakenWhole)
{
    // Only the string constructor can see past a NUL.
    const std::string text("proto://h/a\0b?q", 15);
    Wq5Url url(text);
    EXPECT_EQ(std::string("/a\0b", 4), url.getPath());
    EXPECT_EQ("q", url.getQuery());
}

}  // namespace

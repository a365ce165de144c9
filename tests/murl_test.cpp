// URL decomposition: the character-search rules, row by row.
#include <gtest/gtest.h>

#include <cstring>
#include <string>
#include <tuple>

#include "src/murl.h"

// Every part, the two without a getter included, and the text kept.
struct Wq5UrlTestAccess {
    typedef std::tuple<std::string, std::string, int, std::string, std::string, std::string, std::string,
                       std::string, std::string>
        Parts;  // scheme, host, port, path, file, query, reference, partial form, text
    static Parts parts(const Wq5Url& u)
    {
        return Parts(u.m_scheme, u.getHost(), u.m_port, u.getPath(), u.getFile(), u.getQuery(), u.getRef(),
                     u.getPartialForm(), u.m_url);
    }
};

namespace {

// Parts in this order; port -1: none.
struct UrlCase { const char *input, *scheme, *host; int port; const char *path, *file, *query, *ref, *partialForm; };

const UrlCase URL_CASES[] = {
    {"proto://host:8080/dir/file?q#ref", "proto", "host", 8080, "/dir/file", "file", "q", "ref",
     "proto://host:8080/dir/file"},
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

typedef Wq5UrlTestAccess::Parts Parts;

TEST(Wq5Url, DecomposesEveryCaseFromATextOrAString)
{
    for (const UrlCase& c : URL_CASES) {
        const Parts expected(c.scheme, c.host, c.port, c.path, c.file, c.query, c.ref, c.partialForm, c.input);
        EXPECT_EQ(expected, Wq5UrlTestAccess::parts(Wq5Url(c.input))) << "text <" << c.input << ">";
        EXPECT_EQ(expected, Wq5UrlTestAccess::parts(Wq5Url(std::string(c.input)))) << "string <" << c.input << ">";
    }
    const char* null = nullptr;
    EXPECT_EQ(Parts("", "", -1, "", "", "", "", "", ""), Wq5UrlTestAccess::parts(Wq5Url(null)));
    char text[] = "proto://host:81/dir/file?q#r";  // the parts own their characters
    Wq5Url url(text);
    memset(text, 'x', sizeof(text) - 1);
    EXPECT_EQ(Parts("proto", "host", 81, "/dir/file", "file", "q", "r", "proto://host:81/dir/file",
                    "proto://host:81/dir/file?q#r"),
              Wq5UrlTestAccess::parts(url));
}

}  // namespace

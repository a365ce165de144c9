// URL decomposition on any bytes: both constructors, and the promises the
// parts make whatever the text (every part is a piece of the URL, the
// partial form is its beginning, nothing reaches past its end).
#include <cstdint>
#include <cstdlib>
#include <string>

#include "src/murl.h"

struct Wq5UrlTestAccess {
    static const std::string& scheme(const Wq5Url& url) { return url.m_scheme; }
};

namespace {

void check(bool ok)
{
    if (!ok)
        abort();
}

void checkParts(const Wq5Url& parts, const std::string& url)
{
    check(url.compare(0, parts.getPartialForm().size(), parts.getPartialForm()) == 0);
    check(parts.getPartialForm().find('?') == std::string::npos);
    check(url.compare(0, Wq5UrlTestAccess::scheme(parts).size(), Wq5UrlTestAccess::scheme(parts)) == 0);
    for (const std::string* part : {&parts.getHost(), &parts.getPath(), &parts.getFile(), &parts.getQuery(),
                                    &parts.getRef()})
        check(url.find(*part) != std::string::npos);
    // The file is the path's last segment.
    const std::string& path = parts.getPath();
    const std::string& file = parts.getFile();
    check(file.size() <= path.size() && path.compare(path.size() - file.size(), file.size(), file) == 0);
    check(file.find('/') == std::string::npos);
    check(path.empty() || path[0] == '/' || parts.getHost().empty());
}

}  // namespace

extern "C" int LLVMFuzzerTestOneInput(const uint8_t* data, size_t size)
{
    const std::string url(reinterpret_cast<const char*>(data), size);
    checkParts(Wq5Url(url), url);
    // The C-string form ends at the first NUL.
    const std::string text(url.c_str());
    checkParts(Wq5Url(text.c_str()), text);
    return 0;
}

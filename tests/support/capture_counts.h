// The captures beside the checkout (and our own samples/demo.har) with the
// records each yields when replayed once with every switch on, counted by
// hand: one "hpage" per page (its document), one "hobj" per other request,
// one "video" or "audio" per streaming response; data: URLs are skipped. A
// malformed capture yields nothing but one error line.
#ifndef WQ5_TESTS_CAPTURE_COUNTS_H
#define WQ5_TESTS_CAPTURE_COUNTS_H

#include <array>
#include <string>

namespace wq5test {

// Third-party captures live beside the checkout; a missing folder fails.
inline const std::string CAPTURES = WQ5_SOURCE_DIR "/../shared/captures/";
inline const std::string DEMO = WQ5_SOURCE_DIR "/samples/demo.har";

struct CaptureRow {
    const char* file;
    std::array<int, 4> records;  // hpage, hobj, video, audio
    int skipped;
    const char* error = nullptr;  // expected after "zub1api: <path>: "
};
inline const CaptureRow CAPTURE_ROWS[] = {
    {"hv-chrome51.har", {1, 3, 0, 0}, 0},           // requests without response (status 0)
    {"hv-data-url.har", {0, 0, 0, 0}, 1},           // its only entry is a data: URL
    {"hv-ff47.har", {1, 2, 0, 0}, 0},               // HAR 1.1, +01:00
    {"hv-from-cache.har", {1, 0, 0, 0}, 0},         // no pages; a 304 document
    {"hv-multiple-pages.har", {3, 6, 0, 0}, 0},
    {"hv-no-page-log.har", {1, 0, 0, 0}, 0},        // no pages, no document
    {"hv-no-page-timings.har", {1, 1, 0, 0}, 0},
    {"hv-simple-page-load.har", {1, 0, 0, 0}, 0},
    {"hv-time-stamps.har", {1, 1, 0, 0}, 0},
    {"hv-url-params.har", {1, 0, 0, 0}, 0},
    {"mp-charles.har", {1, 0, 0, 0}, 0},            // -07:00
    {"mp-chrome.har", {2, 1, 0, 0}, 0},             // an entry of a page not listed
    {"mp-insomnia.har", {1, 0, 0, 0}, 0},
    {"mp-successful-log.har", {1, 1, 0, 0}, 0},     // microsecond fractions
    {"mp-websocket.har", {1, 2, 0, 0}, 0},          // 101 upgrades, no content type
    {"mp-with-bom.har", {1, 0, 0, 0}, 0},
    {"px-all-sizes.har", {1, 10, 0, 0}, 0},
    {"px-frontend-redirect.har", {3, 9, 0, 0}, 0},  // three pages, each with a redirect page
    {"px-http1.1-chrome.har", {1, 12, 0, 0}, 0},
    {"px-http2-firefox.har", {1, 9, 0, 0}, 0},      // content sizes -1
    {"px-minus-size-firefox.har", {1, 9, 0, 0}, 0},
    {"demo.har", {4, 9, 1, 1}, 1},                  // ours: samples/demo.har
    {"hv-not-json.har", {}, 0, "not a HAR capture: invalid JSON"},
    {"hv-not-valid.har", {}, 0, "not a HAR capture: \"log\" has no \"entries\" array"},
    {"mp-broken.har", {}, 0, "not a HAR capture: invalid JSON"},
};

inline std::string capturePath(const std::string& file) { return file == "demo.har" ? DEMO : CAPTURES + file; }

}  // namespace wq5test

#endif

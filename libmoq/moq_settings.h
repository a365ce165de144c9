// Settings of libmoq and the parsing of MOQ_TRACE: private to the library
// and its tests, not part of the platform interface.
#ifndef WQ5_LIBMOQ_MOQ_SETTINGS_H
#define WQ5_LIBMOQ_MOQ_SETTINGS_H

#include <cstddef>

#include "platform/moq.h"

#define MOQ_EXPORT __attribute__((visibility("default")))

namespace moq {

// Class mask used when MOQ_TRACE is unset, empty or not understood.
constexpr int DEFAULT_MASK = TRC_ERROR | TRC_FLOW | TRC_INFO;

// The four class bits together: what "all" stands for.
constexpr int ALL_MASK = TRC_ERROR | TRC_FLOW | TRC_INFO | TRC_DETAIL;

// Longest message text kept whole; a longer one is cut there and marked.
constexpr size_t MAX_MESSAGE = 64 * 1024;

// Parses a MOQ_TRACE value: a number from 0 to 2147483647, decimal or hex
// with a 0x prefix, or a comma list of the names error, flow, info, detail,
// all and none (any case, blanks around names allowed). Stores the mask and
// returns true; returns false with `mask` untouched for anything else,
// including an empty text or an empty list item.
MOQ_EXPORT bool parseMask(const char* text, int* mask);

}  // namespace moq

#endif

#pragma once
// Reads JSON texts with simdjson's DOM parser (it picks the CPU's best kernels at run time).
// Texts must be strict UTF-8 JSON; numbers that overflow a double (or integers that overflow 64
// bits) and texts nested deeper than kMaxDepth are refused, so callers never see an infinity and
// never recurse without bound. The parsed document lives in the parser until its next parse; one
// parser serves one thread at a time.

#include <simdjson.h>

#include <string_view>

class JsonDom
{
public:
    static constexpr size_t kMaxDepth = 64;

    // SUCCESS and *out set, or the reason the text was refused.
    static simdjson::error_code parse(simdjson::dom::parser& parser, std::string_view text,
                                      simdjson::dom::element* out);
    // The same, with a parser of this thread's own (kept for the next call: small texts only).
    static simdjson::error_code parseSmall(std::string_view text, simdjson::dom::element* out);
};

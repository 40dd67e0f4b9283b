#include "JsonDom.h"

simdjson::error_code JsonDom::parse(simdjson::dom::parser& parser, std::string_view text,
                                    simdjson::dom::element* out)
{
    // A parser allocates for the largest text it has seen; a new one starts with simdjson's
    // default depth, which is far above ours.
    if (parser.max_depth() != kMaxDepth || parser.capacity() < text.size()) {
        const size_t capacity = text.size() > parser.capacity() ? text.size() : parser.capacity();
        if (const simdjson::error_code error = parser.allocate(capacity, kMaxDepth)) {
            return error;
        }
    }
    return parser.parse(text.data(), text.size()).get(*out);
}

simdjson::error_code JsonDom::parseSmall(std::string_view text, simdjson::dom::element* out)
{
    thread_local simdjson::dom::parser parser;
    return parse(parser, text, out);
}

#pragma once
// The store's JSON writer: the texts it keeps and hands out (attributes, thumbnails with their
// vectors). Reading is simdjson's (JsonDom); values are written back compact, numbers with
// std::to_chars, so what is handed out reads back to what came in.

#include <simdjson.h>

#include <string>
#include <string_view>

namespace tamsa {

// Appends `text` (UTF-8) as a JSON string: quotes, backslashes and control characters escaped.
void appendJsonString(std::string* out, std::string_view text);

// Appends the value as compact JSON. The value comes from JsonDom, so its depth is bounded.
void appendJson(std::string* out, simdjson::dom::element value);

// Writes a float so that reading it back as a float gives the same value, quickly (9 significant
// digits, trailing zeros dropped). Returns the number of characters written (<= 24).
int formatFloat(float value, char* out);

// Appends [v0,v1,...] written with formatFloat.
void appendFloatArray(std::string* out, const float* values, size_t count);

} // namespace tamsa

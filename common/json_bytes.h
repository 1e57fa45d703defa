// The JSON form of text that may hold bytes which are not UTF-8.
//
// Names and paths are byte strings: a file system or a queue file may hold
// any byte.  JSON strings are Unicode, so every JSON text written by the
// tool and the daemon encodes each byte that is not part of valid UTF-8 (a
// stray continuation byte, a truncated or overlong sequence, a surrogate
// encoded in UTF-8, a byte 0xF5 to 0xFF, a code point above U+10FFFF) as
// the escape \udcXY, where XY is the byte in hexadecimal: the lone low
// surrogate U+DC80 to U+DCFF, as Python's "surrogateescape" error handler
// does.  Valid UTF-8 passes unchanged, so the output is valid JSON that a
// strict parser accepts, and DecodeRawBytes turns what a JSON reader makes
// of it back into the original bytes.
#ifndef ZORVNOTIFYD_COMMON_JSON_BYTES_H_
#define ZORVNOTIFYD_COMMON_JSON_BYTES_H_

#include <string>
#include <string_view>

#include <json/json.h>

namespace zorvcommon {

// The length of the valid UTF-8 sequence at the start of |text| (1 for an
// ASCII byte), or 0 when |text| is empty or its first byte does not begin
// one (overlong forms, surrogates and code points above U+10FFFF do not).
size_t Utf8SequenceLength(std::string_view text);

// Appends |text| to |out| as a JSON string, quotes included: '"', '\' and
// control bytes escaped (\n, \t, ... or \u00XX), each byte that is not part
// of valid UTF-8 as \udcXY, valid UTF-8 as it is.  True when some byte was
// not UTF-8, so that a caller learns it without a second pass.
bool AppendJsonString(std::string* out, std::string_view text);

// Appends the standard base64 of |bytes| (RFC 4648 section 4, with "="
// padding, no line breaks).  A reader that loses a lone surrogate (most do
// other than Python's) gets the exact bytes of a name back from it.
void AppendBase64(std::string* out, std::string_view bytes);

// |text| with each UTF-8 encoding of a code point U+DC80 to U+DCFF (the
// bytes ED B2 80 to ED B3 BF, which a JSON reader makes of "\udc80" to
// "\udcff") replaced by the single byte 0x80 to 0xFF.  Valid UTF-8 never
// holds these sequences, so nothing else changes.
std::string DecodeRawBytes(std::string_view text);

// Applies DecodeRawBytes to every string in |value|, at any depth (object
// keys included).
void DecodeRawBytes(Json::Value* value);

}  // namespace zorvcommon

#endif  // ZORVNOTIFYD_COMMON_JSON_BYTES_H_

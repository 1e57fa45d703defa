// Encoding and decoding of bytes that are not UTF-8 in JSON strings.

#include "json_bytes.h"

#include <cstdint>
#include <utility>

namespace zorvcommon {
namespace {

bool Continuation(unsigned char byte) { return (byte & 0xC0) == 0x80; }

}  // namespace

// The ranges of the second byte exclude overlong forms, surrogates and code
// points above U+10FFFF.
size_t Utf8SequenceLength(std::string_view text) {
  if (text.empty()) return 0;
  const auto at = [&text](size_t i) { return static_cast<unsigned char>(text[i]); };
  const unsigned char lead = at(0);
  if (lead < 0x80) return 1;
  size_t length;
  unsigned char low = 0x80, high = 0xBF;  // the range of the second byte
  if (lead >= 0xC2 && lead <= 0xDF) {
    length = 2;
  } else if (lead >= 0xE0 && lead <= 0xEF) {
    length = 3;
    if (lead == 0xE0) low = 0xA0;
    if (lead == 0xED) high = 0x9F;
  } else if (lead >= 0xF0 && lead <= 0xF4) {
    length = 4;
    if (lead == 0xF0) low = 0x90;
    if (lead == 0xF4) high = 0x8F;
  } else {
    return 0;
  }
  if (text.size() < length || at(1) < low || at(1) > high) return 0;
  for (size_t i = 2; i < length; ++i) {
    if (!Continuation(at(i))) return 0;
  }
  return length;
}

// One pass: runs of bytes that pass unchanged (printable ASCII but '"' and
// '\', and whole valid UTF-8 sequences) are appended at once, and each
// byte that needs an escape ends a run.
bool AppendJsonString(std::string* out, std::string_view text) {
  static const char kHex[] = "0123456789abcdef";
  bool raw = false;
  out->push_back('"');
  const char* const end = text.data() + text.size();
  const char* run = text.data();
  for (const char* p = run; p < end;) {
    const auto byte = static_cast<unsigned char>(*p);
    if (byte >= 0x20 && byte < 0x80 && byte != '"' && byte != '\\') {
      ++p;
      continue;
    }
    if (byte >= 0x80) {
      const size_t length = Utf8SequenceLength(std::string_view(p, size_t(end - p)));
      if (length > 1) {
        p += length;
        continue;
      }
    }
    out->append(run, size_t(p - run));
    run = ++p;
    const char* escape = nullptr;
    switch (byte) {
      case '"':
        escape = "\\\"";
        break;
      case '\\':
        escape = "\\\\";
        break;
      case '\n':
        escape = "\\n";
        break;
      case '\t':
        escape = "\\t";
        break;
      case '\r':
        escape = "\\r";
        break;
      case '\b':
        escape = "\\b";
        break;
      case '\f':
        escape = "\\f";
        break;
    }
    if (escape != nullptr) {
      out->append(escape, 2);
      continue;
    }
    // A control byte as \u00XX; a byte outside UTF-8 as \udcXY.
    raw = raw || byte >= 0x80;
    const char escaped[6] = {
        '\\',           'u', byte < 0x80 ? '0' : 'd', byte < 0x80 ? '0' : 'c', kHex[byte >> 4],
        kHex[byte & 15]};
    out->append(escaped, sizeof(escaped));
  }
  out->append(run, size_t(end - run));
  out->push_back('"');
  return raw;
}

void AppendBase64(std::string* out, std::string_view bytes) {
  static const char kDigits[] = "ABCDEFGHIJKLMNOPQRSTUVWXYZabcdefghijklmnopqrstuvwxyz0123456789+/";
  const auto at = [&bytes](size_t i) { return static_cast<unsigned char>(bytes[i]); };
  size_t i = 0;
  for (; i + 3 <= bytes.size(); i += 3) {
    const uint32_t group = (uint32_t{at(i)} << 16) | (uint32_t{at(i + 1)} << 8) | at(i + 2);
    for (int shift = 18; shift >= 0; shift -= 6) out->push_back(kDigits[(group >> shift) & 63]);
  }
  const size_t left = bytes.size() - i;
  if (left == 0) return;
  const uint32_t group = (uint32_t{at(i)} << 16) | (left == 2 ? uint32_t{at(i + 1)} << 8 : 0);
  out->push_back(kDigits[group >> 18]);
  out->push_back(kDigits[(group >> 12) & 63]);
  out->push_back(left == 2 ? kDigits[(group >> 6) & 63] : '=');
  out->push_back('=');
}

std::string DecodeRawBytes(std::string_view text) {
  std::string decoded;
  decoded.reserve(text.size());
  for (size_t i = 0; i < text.size(); ++i) {
    const auto at = [&text](size_t j) { return static_cast<unsigned char>(text[j]); };
    if (at(i) == 0xED && i + 2 < text.size() && (at(i + 1) == 0xB2 || at(i + 1) == 0xB3) &&
        Continuation(at(i + 2))) {
      decoded.push_back(static_cast<char>(((at(i + 1) & 0x03) << 6) | (at(i + 2) & 0x3F)));
      i += 2;
    } else {
      decoded.push_back(text[i]);
    }
  }
  return decoded;
}

void DecodeRawBytes(Json::Value* value) {
  if (value->isString()) {
    *value = DecodeRawBytes(value->asString());
  } else if (value->isArray()) {
    for (Json::Value& element : *value) DecodeRawBytes(&element);
  } else if (value->isObject()) {
    Json::Value decoded(Json::objectValue);
    // Each member moved, not copied: a deep document is walked once.
    for (const std::string& key : value->getMemberNames()) {
      Json::Value& member = (*value)[key];
      DecodeRawBytes(&member);
      decoded[DecodeRawBytes(key)] = std::move(member);
    }
    *value = std::move(decoded);
  }
}

}  // namespace zorvcommon

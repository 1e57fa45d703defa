#include "subscription/wire_record.h"

#include <string.h>

namespace ZORV {
namespace ZORVNOTIFYD {
namespace subscription {
namespace {

constexpr int kMaxDepth = 16;

// A cursor over the text; every method fails rather than read past the end.
class Parser {
 public:
  Parser(const char* data, size_t size) : p_(data), end_(data + size) {}

  void SkipSpace() {
    while (p_ < end_ && (*p_ == ' ' || *p_ == '\t' || *p_ == '\n' || *p_ == '\r')) ++p_;
  }
  bool AtEnd() {
    SkipSpace();
    return p_ == end_;
  }
  // Consumes |c| (after white space) when it is next.
  bool Take(char c) {
    SkipSpace();
    if (p_ < end_ && *p_ == c) {
      ++p_;
      return true;
    }
    return false;
  }
  bool Peek(char c) {
    SkipSpace();
    return p_ < end_ && *p_ == c;
  }
  bool Word(const char* word) {
    SkipSpace();
    const size_t n = strlen(word);
    if (size_t(end_ - p_) < n || memcmp(p_, word, n) != 0) return false;
    p_ += n;
    return true;
  }

  // A JSON string into |out| (cleared first; its capacity is kept).
  bool String(std::string* out) {
    out->clear();
    if (!Take('"')) return false;
    while (p_ < end_) {
      const unsigned char c = static_cast<unsigned char>(*p_++);
      if (c == '"') return true;
      if (c < 0x20) return false;
      if (c != '\\') {
        out->push_back(static_cast<char>(c));
        continue;
      }
      if (p_ == end_) return false;
      switch (*p_++) {
        case '"':
          out->push_back('"');
          break;
        case '\\':
          out->push_back('\\');
          break;
        case '/':
          out->push_back('/');
          break;
        case 'b':
          out->push_back('\b');
          break;
        case 'f':
          out->push_back('\f');
          break;
        case 'n':
          out->push_back('\n');
          break;
        case 'r':
          out->push_back('\r');
          break;
        case 't':
          out->push_back('\t');
          break;
        case 'u':
          if (!Escape(out)) return false;
          break;
        default:
          return false;
      }
    }
    return false;
  }

  // A whole number in [0, max]: digits only, no leading zero.
  bool Unsigned(uint64_t max, uint64_t* out) {
    SkipSpace();
    if (p_ == end_ || *p_ < '0' || *p_ > '9') return false;
    if (*p_ == '0' && p_ + 1 < end_ && p_[1] >= '0' && p_[1] <= '9') return false;
    uint64_t value = 0;
    for (; p_ < end_ && *p_ >= '0' && *p_ <= '9'; ++p_) {
      const uint64_t digit = uint64_t(*p_ - '0');
      if (value > (max - digit) / 10) return false;
      value = value * 10 + digit;
    }
    if (p_ < end_ && (*p_ == '.' || *p_ == 'e' || *p_ == 'E')) return false;
    *out = value;
    return true;
  }

  bool Bool(bool* out) {
    if (Word("true")) {
      *out = true;
      return true;
    }
    *out = false;
    return Word("false");
  }

  // Any JSON value, skipped.
  bool Skip(int depth) {
    if (depth > kMaxDepth) return false;
    SkipSpace();
    if (p_ == end_) return false;
    switch (*p_) {
      case '"':
        return String(&scratch_);
      case 't':
        return Word("true");
      case 'f':
        return Word("false");
      case 'n':
        return Word("null");
      case '[':
        ++p_;
        if (Take(']')) return true;
        do {
          if (!Skip(depth + 1)) return false;
        } while (Take(','));
        return Take(']');
      case '{':
        ++p_;
        if (Take('}')) return true;
        do {
          if (!String(&scratch_) || !Take(':') || !Skip(depth + 1)) return false;
        } while (Take(','));
        return Take('}');
      default:
        return Number();
    }
  }

 private:
  // After "\u": the escape's code point, or a pair of them, as UTF-8; a
  // lone \udc80..\udcff as the byte it stands for.
  bool Escape(std::string* out) {
    uint32_t unit;
    if (!Hex4(&unit)) return false;
    uint32_t point = unit;
    if (unit >= 0xd800 && unit <= 0xdbff) {
      uint32_t low;
      if (end_ - p_ < 2 || p_[0] != '\\' || p_[1] != 'u') return false;
      p_ += 2;
      if (!Hex4(&low) || low < 0xdc00 || low > 0xdfff) return false;
      point = 0x10000 + ((unit - 0xd800) << 10) + (low - 0xdc00);
    } else if (unit >= 0xdc00 && unit <= 0xdfff) {
      if (unit < 0xdc80 || unit > 0xdcff) return false;
      out->push_back(static_cast<char>(unit - 0xdc00));
      return true;
    }
    if (point < 0x80) {
      out->push_back(static_cast<char>(point));
    } else if (point < 0x800) {
      out->push_back(static_cast<char>(0xc0 | (point >> 6)));
      out->push_back(static_cast<char>(0x80 | (point & 0x3f)));
    } else if (point < 0x10000) {
      out->push_back(static_cast<char>(0xe0 | (point >> 12)));
      out->push_back(static_cast<char>(0x80 | ((point >> 6) & 0x3f)));
      out->push_back(static_cast<char>(0x80 | (point & 0x3f)));
    } else {
      out->push_back(static_cast<char>(0xf0 | (point >> 18)));
      out->push_back(static_cast<char>(0x80 | ((point >> 12) & 0x3f)));
      out->push_back(static_cast<char>(0x80 | ((point >> 6) & 0x3f)));
      out->push_back(static_cast<char>(0x80 | (point & 0x3f)));
    }
    return true;
  }

  bool Hex4(uint32_t* out) {
    if (end_ - p_ < 4) return false;
    uint32_t value = 0;
    for (int i = 0; i < 4; ++i) {
      const char c = *p_++;
      const int digit = c >= '0' && c <= '9'   ? c - '0'
                        : c >= 'a' && c <= 'f' ? c - 'a' + 10
                        : c >= 'A' && c <= 'F' ? c - 'A' + 10
                                               : -1;
      if (digit < 0) return false;
      value = value * 16 + uint32_t(digit);
    }
    *out = value;
    return true;
  }

  // A JSON number of any form.
  bool Number() {
    if (p_ < end_ && *p_ == '-') ++p_;
    if (!Digits(true)) return false;
    if (p_ < end_ && *p_ == '.') {
      ++p_;
      if (!Digits(false)) return false;
    }
    if (p_ < end_ && (*p_ == 'e' || *p_ == 'E')) {
      ++p_;
      if (p_ < end_ && (*p_ == '+' || *p_ == '-')) ++p_;
      if (!Digits(false)) return false;
    }
    return true;
  }
  bool Digits(bool integer_part) {
    const char* start = p_;
    while (p_ < end_ && *p_ >= '0' && *p_ <= '9') ++p_;
    if (p_ == start) return false;
    return !(integer_part && *start == '0' && p_ - start > 1);
  }

  const char* p_;
  const char* end_;
  std::string scratch_;  // skipped strings; grows once
};

bool ParseType(const std::string& text, _tag_monitor_queue_type_* type) {
  if (text == "share") {
    *type = MONITOR_QUEUE_TYPE_SHARE_DIR;
  } else if (text == "etc") {
    *type = MONITOR_QUEUE_TYPE_ETC_DIR;
  } else if (text == "local-etc") {
    *type = MONITOR_QUEUE_TYPE_LOCAL_ETC_DIR;
  } else {
    return false;
  }
  return true;
}

// One {"type":..,"file":..,"seq":N} of a reply's "queues"; other members
// skipped.
bool ParseQueue(Parser& in, std::string& key, std::string& text, WireQueue* queue) {
  bool type = false, file = false, seq = false;
  if (!in.Take('{')) return false;
  if (!in.Take('}')) {
    do {
      if (!in.String(&key) || !in.Take(':')) return false;
      if (key == "type") {
        if (type || !in.String(&text) || !ParseType(text, &queue->type)) return false;
        type = true;
      } else if (key == "file") {
        if (file || !in.String(&queue->file)) return false;
        file = true;
      } else if (key == "seq") {
        if (seq || !in.Unsigned(UINT64_MAX, &queue->seq)) return false;
        seq = true;
      } else if (!in.Skip(2)) {
        return false;
      }
    } while (in.Take(','));
    if (!in.Take('}')) return false;
  }
  return type && file && seq;
}

// The bytes of standard base64 |text| (with its "=" padding) into |out|
// (cleared first; its capacity is kept); false when |text| is not such.
bool DecodeBase64(const std::string& text, std::string* out) {
  out->clear();
  if (text.size() % 4 != 0) return false;
  uint32_t group = 0;
  size_t padding = 0;
  for (size_t i = 0; i < text.size(); ++i) {
    const char c = text[i];
    uint32_t digit;
    if (c >= 'A' && c <= 'Z') {
      digit = uint32_t(c - 'A');
    } else if (c >= 'a' && c <= 'z') {
      digit = uint32_t(c - 'a') + 26;
    } else if (c >= '0' && c <= '9') {
      digit = uint32_t(c - '0') + 52;
    } else if (c == '+' || c == '/') {
      digit = c == '+' ? 62 : 63;
    } else if (c == '=' && i + 2 >= text.size() &&
               (padding > 0 || i + 1 == text.size() || text[i + 1] == '=')) {
      digit = 0;
      ++padding;
    } else {
      return false;
    }
    if (padding > 0 && c != '=') return false;
    group = (group << 6) | digit;
    if (i % 4 == 3) {
      // The bits after the last byte are 0: one text for each byte string.
      if (padding > 0 && (group & (padding == 2 ? 0xffff : 0xff)) != 0) return false;
      out->push_back(char(group >> 16));
      if (padding < 2) out->push_back(char(group >> 8));
      if (padding < 1) out->push_back(char(group));
      group = 0;
    }
  }
  return true;
}

}  // namespace

bool ParseWireRecord(const char* data, size_t size, WireRecord* out) {
  WireRecord& r = *out;
  r.has_reply = r.has_error = r.has_queue = r.has_type = r.has_file = r.has_seq = r.has_path =
      r.has_mask = r.has_missed = r.has_rescan = r.has_journal = r.has_queues = false;
  r.lost = r.removed = r.registered = r.offline = false;
  r.seq = r.missed = 0;
  r.mask = 0;
  r.type = MONITOR_QUEUE_TYPE_SHARE_DIR;
  r.queue_count = 0;
  bool has_lost = false, has_removed = false, has_registered = false, has_offline = false;
  // A name's "KEY_b64" holds its exact bytes: it wins over "KEY", in
  // whichever order the two come.
  bool queue_b64 = false, file_b64 = false, path_b64 = false, rescan_b64 = false;

  Parser in(data, size);
  std::string& name = r.scratch_key;
  std::string& text = r.scratch_text;
  if (!in.Take('{')) return false;
  if (!in.Take('}')) {
    do {
      if (!in.String(&name) || !in.Take(':')) return false;
      // Each known member once, of its type.
      auto once = [](bool* seen) {
        if (*seen) return false;
        *seen = true;
        return true;
      };
      bool ok;
      if (name == "queue") {
        ok = once(&r.has_queue) && in.String(queue_b64 ? &text : &r.queue);
      } else if (name == "queue_b64") {
        ok = once(&queue_b64) && in.String(&text) && DecodeBase64(text, &r.queue);
      } else if (name == "type") {
        ok = once(&r.has_type) && in.String(&text) && ParseType(text, &r.type);
      } else if (name == "file") {
        ok = once(&r.has_file) && in.String(file_b64 ? &text : &r.file);
      } else if (name == "file_b64") {
        ok = once(&file_b64) && in.String(&text) && DecodeBase64(text, &r.file);
      } else if (name == "seq") {
        ok = once(&r.has_seq) && in.Unsigned(UINT64_MAX, &r.seq);
      } else if (name == "path") {
        ok = once(&r.has_path) && in.String(path_b64 ? &text : &r.path);
      } else if (name == "path_b64") {
        ok = once(&path_b64) && in.String(&text) && DecodeBase64(text, &r.path);
      } else if (name == "mask") {
        uint64_t mask = 0;
        ok = once(&r.has_mask) && in.Unsigned(UINT32_MAX, &mask);
        r.mask = uint32_t(mask);
      } else if (name == "missed") {
        ok = once(&r.has_missed) && in.Unsigned(UINT64_MAX, &r.missed);
      } else if (name == "rescan") {
        ok = once(&r.has_rescan) && in.String(rescan_b64 ? &text : &r.rescan);
      } else if (name == "rescan_b64") {
        ok = once(&rescan_b64) && in.String(&text) && DecodeBase64(text, &r.rescan);
      } else if (name == "lost") {
        ok = once(&has_lost) && in.Bool(&r.lost);
      } else if (name == "removed") {
        ok = once(&has_removed) && in.Bool(&r.removed);
      } else if (name == "registered") {
        ok = once(&has_registered) && in.Bool(&r.registered);
      } else if (name == "offline") {
        ok = once(&has_offline) && in.Bool(&r.offline);
      } else if (name == "reply") {
        ok = once(&r.has_reply) && in.String(&r.reply);
      } else if (name == "error") {
        ok = once(&r.has_error) && in.String(&r.error);
      } else if (name == "journal") {
        ok = once(&r.has_journal) && in.String(&r.journal);
      } else if (name == "queues" && in.Peek('[')) {
        // The queues of a subscribe reply (a status reply counts them).
        ok = once(&r.has_queues) && in.Take('[');
        if (ok && !in.Take(']')) {
          do {
            if (r.queue_count == r.queues.size()) r.queues.emplace_back();
            ok = ParseQueue(in, name, text, &r.queues[r.queue_count++]);
          } while (ok && in.Take(','));
          ok = ok && in.Take(']');
        }
      } else {
        ok = in.Skip(2);
      }
      if (!ok) return false;
    } while (in.Take(','));
    if (!in.Take('}')) return false;
  }
  return in.AtEnd();
}

}  // namespace subscription
}  // namespace ZORVNOTIFYD
}  // namespace ZORV

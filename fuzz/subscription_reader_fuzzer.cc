// Fuzz target: the line reader and record reader of
// MonitorQueueSubscription on arbitrary bytes from the daemon's side.
//
// The first byte chooses how the stream is cut into reads.  Checked: no
// line handed out is longer than the bound, nor does the reader take
// bytes once a line overruns it; a record the reader accepts is one that
// jsoncpp's strict reader accepts too (duplicate unknown members, depth
// and numbers beyond a double's range aside), with the same numbers and
// booleans, and with the same strings where the line has no \u escape
// (a name's "KEY_b64", which wins over "KEY", aside); reading is
// deterministic, and a record reused for the next line carries nothing of
// the last one.

#include <algorithm>
#include <cerrno>
#include <cmath>
#include <cstddef>
#include <cstdint>
#include <cstdlib>
#include <memory>
#include <regex>
#include <string>

#include <json/json.h>

#include "fuzz_common.h"
#include "subscription/line_reader.h"
#include "subscription/wire_record.h"

using ZORV::ZORVNOTIFYD::subscription::LineReader;
using ZORV::ZORVNOTIFYD::subscription::ParseWireRecord;
using ZORV::ZORVNOTIFYD::subscription::WireRecord;
using zorv_fuzz::Check;

namespace {

// True when jsoncpp's |errors| refuse a number that JSON's grammar allows
// but a double cannot hold (1e400): the reader skips such a number in a
// member it does not know, as it may.
bool BeyondDouble(const std::string& errors) {
  static const std::regex kRefused(
      "'(-?(0|[1-9][0-9]*)(\\.[0-9]+)?([eE][+-]?[0-9]+)?)' is not a number\\.");
  std::smatch match;
  if (!std::regex_search(errors, match, kRefused)) return false;
  errno = 0;
  const double value = std::strtod(match[1].str().c_str(), nullptr);
  return errno == ERANGE && std::isinf(value);
}

// Compares what |record| read of |line| with jsoncpp's reading.
void CrossCheck(const std::string& line, const WireRecord& record) {
  Json::CharReaderBuilder builder;
  Json::CharReaderBuilder::strictMode(&builder.settings_);
  builder["failIfExtra"] = true;
  builder["rejectDupKeys"] = false;
  builder["stackLimit"] = 100;
  const std::unique_ptr<Json::CharReader> reader(builder.newCharReader());
  Json::Value value;
  std::string errors;
  const bool parsed = reader->parse(line.data(), line.data() + line.size(), &value, &errors);
  if (!parsed && BeyondDouble(errors)) return;
  Check(parsed && value.isObject(), "an accepted record is strict JSON");
  auto number = [&](const char* key, bool has, uint64_t got) {
    Check(has == value.isMember(key), "a number is seen as jsoncpp sees it");
    if (has) Check(value[key].isUInt64() && value[key].asUInt64() == got, "the same number");
  };
  number("seq", record.has_seq, record.seq);
  number("missed", record.has_missed, record.missed);
  number("mask", record.has_mask, record.mask);
  Check(record.lost == (value.isMember("lost") && value["lost"].asBool()), "the same notice");
  Check(record.offline == (value.isMember("offline") && value["offline"].asBool()),
        "the same offline");
  if (line.find("\\u") != std::string::npos) return;
  auto text = [&](const char* key, bool has, const std::string& got) {
    Check(has == value.isMember(key), "a string is seen as jsoncpp sees it");
    // "KEY_b64", the exact bytes, wins over "KEY" when both are there.
    if (has && !value.isMember(std::string(key) + "_b64"))
      Check(value[key].isString() && value[key].asString() == got, "the same string");
  };
  text("queue", record.has_queue, record.queue);
  text("file", record.has_file, record.file);
  text("path", record.has_path, record.path);
  text("journal", record.has_journal, record.journal);
}

}  // namespace

extern "C" int LLVMFuzzerTestOneInput(const uint8_t* data, size_t size) {
  if (size == 0) return 0;
  const size_t cut = size_t(data[0]) * 97 + 1;  // bytes per read
  const char* bytes = reinterpret_cast<const char*>(data + 1);
  size_t left = size - 1;
  LineReader lines;
  static WireRecord record, fresh;
  while (left > 0) {
    const size_t taken = lines.Append(bytes, std::min(cut, left));
    if (taken == 0) {
      Check(lines.Overlong(), "the reader takes bytes until a line overruns");
      break;
    }
    bytes += taken;
    left -= taken;
    const char* line;
    size_t length;
    while (lines.NextLine(&line, &length)) {
      Check(length <= LineReader::kMaxLine, "a line within the bound");
      const std::string text(line, length);
      const bool ok = ParseWireRecord(text.data(), text.size(), &record);
      Check(ok == ParseWireRecord(text.data(), text.size(), &fresh), "deterministic");
      if (!ok) continue;
      Check(record.queue_count <= record.queues.size(), "queues within the array");
      Check(record.has_seq == fresh.has_seq && record.seq == fresh.seq &&
                record.has_path == fresh.has_path &&
                (!record.has_path || record.path == fresh.path),
            "a reused record as a fresh one");
      CrossCheck(text, record);
    }
  }
  return 0;
}

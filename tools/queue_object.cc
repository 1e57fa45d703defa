// Strict validation of queue objects.

#include "queue_object.h"

#include <regex.h>

#include <cstdint>
#include <memory>
#include <sstream>

#include "json_bytes.h"
#include "text.h"
#include "watch_path.h"

namespace zorvnotifyctl {
namespace {

// "a string", "an array", ... for messages about wrong types.
std::string TypeName(const Json::Value& value) {
  switch (value.type()) {
    case Json::nullValue:
      return "null";
    case Json::intValue:
    case Json::uintValue:
      return "an integer";
    case Json::realValue:
      return "a real number";
    case Json::stringValue:
      return "a string";
    case Json::booleanValue:
      return "a boolean";
    case Json::arrayValue:
      return "an array";
    case Json::objectValue:
      return "an object";
  }
  return "an unknown value";
}

// The JSON text of a scalar, for messages.
std::string Text(const Json::Value& value) {
  Json::StreamWriterBuilder writer;
  writer["indentation"] = "";
  return Json::writeString(writer, value);
}

// The reader's error report on one line: "* Line 1, Column 2\n  Syntax
// error...\n" becomes "Line 1, Column 2: Syntax error...".
std::string OneLine(const std::string& report) {
  std::string line;
  std::istringstream in(report);
  for (std::string part; std::getline(in, part);) {
    const size_t start = part.find_first_not_of("* \t");
    if (start == std::string::npos) continue;
    if (!line.empty()) line += ": ";
    line += part.substr(start);
  }
  return line;
}

// Returns "" when |object| has no key outside |allowed| (null-terminated),
// else the message for the first unknown key.
std::string UnknownKeyProblem(const Json::Value& object, const std::string& where,
                              const char* const* allowed, const std::string& allowed_text) {
  for (const std::string& key : object.getMemberNames()) {
    bool known = false;
    for (const char* const* name = allowed; *name != nullptr; ++name) known |= key == *name;
    if (!known) {
      return where + "unknown key \"" + key + "\" (" + allowed_text + ")";
    }
  }
  return std::string();
}

std::string PatternProblem(const std::string& pattern, const std::string& where) {
  // regcomp reads a C string: a NUL would silently cut the pattern short.
  if (pattern.find('\0') != std::string::npos) {
    return where + " " + zorvcommon::Quoted(pattern) +
           " holds a NUL, which would end the regular expression there";
  }
  regex_t compiled;
  const int status = regcomp(&compiled, pattern.c_str(), REG_EXTENDED);
  if (status == 0) {
    regfree(&compiled);
    return std::string();
  }
  char reason[256];
  regerror(status, &compiled, reason, sizeof(reason));
  return where + " " + zorvcommon::Quoted(pattern) +
         " is not a valid extended regular expression: " + reason;
}

std::string MaskProblem(const Json::Value& mask, const std::string& where) {
  if (mask.type() != Json::intValue && mask.type() != Json::uintValue) {
    return where + " must be an unsigned 32-bit integer, not " + TypeName(mask) +
           (mask.isNumeric() ? " (" + Text(mask) + ")" : "");
  }
  if (mask.type() == Json::intValue && mask.asLargestInt() < 0) {
    return where + " must not be negative (" + Text(mask) + ")";
  }
  if (mask.asLargestUInt() > UINT32_MAX) {
    return where + " " + Text(mask) + " does not fit in 32 bits (at most 4294967295)";
  }
  return std::string();
}

std::string ConfigProblem(const Json::Value& config, const std::string& where) {
  static const char* const kKeys[] = {"path", "mask", "ignore", nullptr};
  if (!config.isObject()) return where + " must be an object, not " + TypeName(config);
  std::string problem = UnknownKeyProblem(config, where + ": ", kKeys,
                                          "a watch configuration has only \"path\", "
                                          "\"mask\" and \"ignore\"");
  if (!problem.empty()) return problem;
  if (!config.isMember("path")) return where + ": missing key \"path\" (the watched directory)";
  if (!config["path"].isString()) {
    return where + ".path must be a string, not " + TypeName(config["path"]);
  }
  // The library stores any path, but the daemon matches the paths inotify
  // reports, built from real directory names; a path that none of them can
  // match would be a queue that silently never hears of anything.
  const std::string path = config["path"].asString();
  problem = zorvcommon::WatchPathProblem(path);
  if (!problem.empty()) {
    // The suggested spelling repeats the path, so it is escaped as well.
    return where + ".path " + zorvcommon::Quoted(path) +
           " cannot be watched: " + zorvcommon::Printable(problem);
  }
  if (!config.isMember("mask")) return where + ": missing key \"mask\" (the wanted event kinds)";
  problem = MaskProblem(config["mask"], where + ".mask");
  if (!problem.empty()) return problem;
  if (!config.isMember("ignore")) return std::string();
  const Json::Value& ignore = config["ignore"];
  if (!ignore.isArray()) return where + ".ignore must be an array, not " + TypeName(ignore);
  for (Json::ArrayIndex i = 0; i < ignore.size(); ++i) {
    const std::string at = where + ".ignore[" + std::to_string(i) + "]";
    if (!ignore[i].isString()) return at + " must be a string, not " + TypeName(ignore[i]);
    problem = PatternProblem(ignore[i].asString(), at);
    if (!problem.empty()) return problem;
  }
  return std::string();
}

// Returns "" when |text| holds no comment, else the message for the first.
// Outside strings, JSON never holds "/", so any "/" there begins a comment
// (which the reader would skip, also in strict mode, between the values of
// an object or array) or is a syntax error the reader reports.
std::string CommentProblem(const std::string& text) {
  bool in_string = false;
  size_t line = 1;
  for (size_t i = 0; i < text.size(); ++i) {
    const char c = text[i];
    if (c == '\n') ++line;
    if (in_string) {
      if (c == '\\') {
        ++i;
      } else if (c == '"') {
        in_string = false;
      }
    } else if (c == '"') {
      in_string = true;
    } else if (c == '/' && i + 1 < text.size() && (text[i + 1] == '/' || text[i + 1] == '*')) {
      return "invalid JSON: line " + std::to_string(line) + ": comments are not allowed";
    }
  }
  return std::string();
}

}  // namespace

std::string ParseQueueObject(const std::string& text, Json::Value* queue) {
  Json::CharReaderBuilder builder;
  Json::CharReaderBuilder::strictMode(&builder.settings_);
  const std::unique_ptr<Json::CharReader> reader(builder.newCharReader());
  std::string problem = CommentProblem(text);
  if (!problem.empty()) return problem;
  Json::Value value;
  std::string errors;
  try {
    if (!reader->parse(text.data(), text.data() + text.size(), &value, &errors)) {
      return "invalid JSON: " + OneLine(errors);
    }
  } catch (const Json::Exception& e) {
    // The reader throws when values nest deeper than its stack limit.
    return std::string("invalid JSON: nested too deeply (") + e.what() + ")";
  }
  if (!value.isObject()) return "the queue must be a JSON object, not " + TypeName(value);
  // "\udcXY" stands for the byte XY that is not part of valid UTF-8, as the
  // tool's and the daemon's JSON output write it.
  zorvcommon::DecodeRawBytes(&value);
  static const char* const kKeys[] = {"queue", "config", nullptr};
  problem = UnknownKeyProblem(value, "", kKeys, "a queue object has only \"queue\" and \"config\"");
  if (!problem.empty()) return problem;
  if (!value.isMember("queue")) return "missing key \"queue\" (the queue's name)";
  if (!value["queue"].isString()) {
    return "\"queue\" must be a string, not " + TypeName(value["queue"]);
  }
  if (value.isMember("config")) {
    const Json::Value& configs = value["config"];
    if (!configs.isArray()) return "\"config\" must be an array, not " + TypeName(configs);
    for (Json::ArrayIndex i = 0; i < configs.size(); ++i) {
      problem = ConfigProblem(configs[i], "config[" + std::to_string(i) + "]");
      if (!problem.empty()) return problem;
    }
  }
  *queue = value;
  return std::string();
}

}  // namespace zorvnotifyctl

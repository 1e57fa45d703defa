// Writing JSON output.

#include "json_output.h"

#include <string>

#include "json_bytes.h"

namespace zorvnotifyctl {
namespace {

// Appends |value| at nesting |depth| (indented by two blanks per level).
void Append(std::string* out, const Json::Value& value, size_t depth) {
  const std::string indent(2 * (depth + 1), ' ');
  switch (value.type()) {
    case Json::nullValue:
      out->append("null");
      return;
    case Json::intValue:
      out->append(Json::valueToString(value.asLargestInt()));
      return;
    case Json::uintValue:
      out->append(Json::valueToString(value.asLargestUInt()));
      return;
    case Json::realValue:
      out->append(Json::valueToString(value.asDouble()));
      return;
    case Json::booleanValue:
      out->append(value.asBool() ? "true" : "false");
      return;
    case Json::stringValue:
      zorvcommon::AppendJsonString(out, value.asString());
      return;
    case Json::arrayValue:
    case Json::objectValue:
      break;
  }
  const bool object = value.isObject();
  if (value.empty()) {
    out->append(object ? "{}" : "[]");
    return;
  }
  out->push_back(object ? '{' : '[');
  const std::vector<std::string> keys =
      object ? value.getMemberNames() : std::vector<std::string>();
  for (Json::ArrayIndex i = 0; i < value.size(); ++i) {
    out->append(i == 0 ? "\n" : ",\n");
    out->append(indent);
    if (object) {
      zorvcommon::AppendJsonString(out, keys[i]);
      out->append(": ");
    }
    Append(out, object ? value[keys[i]] : value[i], depth + 1);
  }
  out->push_back('\n');
  out->append(indent.substr(2));
  out->push_back(object ? '}' : ']');
}

}  // namespace

void WriteJson(std::ostream& out, const Json::Value& value) {
  std::string text;
  Append(&text, value, 0);
  text.push_back('\n');
  out << text;
}

}  // namespace zorvnotifyctl

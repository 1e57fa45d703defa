// Writing JSON output.

#include "json_output.h"

#include <memory>

namespace zorvnotifyctl {

void WriteJson(std::ostream& out, const Json::Value& value) {
  Json::StreamWriterBuilder builder;
  builder["indentation"] = "  ";
  const std::unique_ptr<Json::StreamWriter> writer(builder.newStreamWriter());
  writer->write(value, &out);
  out << '\n';
}

}  // namespace zorvnotifyctl

#include "request.h"

#include <exception>
#include <memory>

namespace zorvnotifyd {

bool ParseRequest(const std::string& line, Json::Value* request) noexcept {
  try {
    Json::CharReaderBuilder builder;
    Json::CharReaderBuilder::strictMode(&builder.settings_);
    builder["failIfExtra"] = true;
    builder["stackLimit"] = kMaxRequestDepth;
    const std::unique_ptr<Json::CharReader> reader(builder.newCharReader());
    std::string errors;
    return reader->parse(line.data(), line.data() + line.size(), request, &errors) &&
           request->isObject();
  } catch (const std::exception&) {
    return false;
  }
}

}  // namespace zorvnotifyd

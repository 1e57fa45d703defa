// The masks of the configured paths.

#include "watch_masks.h"

namespace zorvnotifyd {

WatchMasks::WatchMasks(const Catalogue& catalogue) {
  auto table = std::make_shared<Table>();
  size_t configs = 0;
  for (const CatalogueQueue& entry : catalogue) configs += entry.queue._configs.size();
  // Room for every path first: the keys view the strings, which must not
  // move once viewed.
  table->paths.reserve(configs);
  table->masks.reserve(configs);
  for (const CatalogueQueue& entry : catalogue) {
    for (const auto& config : entry.queue._configs) {
      const auto found = table->masks.find(config._path);
      if (found != table->masks.end()) {
        found->second |= config._mask;
        continue;
      }
      table->paths.push_back(config._path);
      table->masks.emplace(table->paths.back(), config._mask);
    }
  }
  table_ = std::move(table);
}

uint32_t WatchMasks::For(std::string_view dir) const {
  if (table_ == nullptr || table_->masks.empty()) return 0;
  uint32_t mask = 0;
  for (size_t length = 0;; ++length) {
    if (length == dir.size() || dir[length] == '/') {
      const auto found = table_->masks.find(dir.substr(0, length));
      if (found != table_->masks.end()) mask |= found->second;
    }
    if (length == dir.size()) return mask;
  }
}

}  // namespace zorvnotifyd

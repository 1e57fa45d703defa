// The masks of the configured paths.

#include "watch_masks.h"

namespace zorvnotifyd {
namespace {

constexpr uint64_t kHashStart = 14695981039346656037u;

uint64_t HashByte(uint64_t hash, char byte) {
  return (hash ^ static_cast<unsigned char>(byte)) * 1099511628211u;
}

}  // namespace

long WatchMasks::Table::Find(uint64_t hash, std::string_view path) const {
  const size_t last = slots.size() - 1;
  for (size_t slot = hash & last; slots[slot] != 0; slot = (slot + 1) & last) {
    const uint32_t i = slots[slot] - 1;
    if (hashes[i] == hash && paths[i] == path) return i;
  }
  return -1;
}

WatchMasks::WatchMasks(const Catalogue& catalogue) {
  auto table = std::make_shared<Table>();
  size_t configs = 0;
  for (const CatalogueQueue& entry : catalogue) configs += entry.queue._configs.size();
  size_t size = 1;
  while (size < 2 * configs) size *= 2;  // at most half full
  table->slots.assign(size, 0);
  for (const CatalogueQueue& entry : catalogue) {
    for (const auto& config : entry.queue._configs) {
      uint64_t hash = kHashStart;
      for (char byte : config._path) hash = HashByte(hash, byte);
      const long found = table->Find(hash, config._path);
      if (found >= 0) {
        table->masks[found] |= config._mask;
        continue;
      }
      size_t slot = hash & (size - 1);
      while (table->slots[slot] != 0) slot = (slot + 1) & (size - 1);
      table->slots[slot] = static_cast<uint32_t>(table->paths.size() + 1);
      table->paths.push_back(config._path);
      table->hashes.push_back(hash);
      table->masks.push_back(config._mask);
    }
  }
  table_ = std::move(table);
}

uint32_t WatchMasks::For(std::string_view dir) const {
  if (table_ == nullptr || table_->paths.empty()) return 0;
  uint32_t mask = 0;
  uint64_t hash = kHashStart;
  for (size_t length = 0;; ++length) {
    if (length == dir.size() || dir[length] == '/') {
      const long found = table_->Find(hash, dir.substr(0, length));
      if (found >= 0) mask |= table_->masks[found];
    }
    if (length == dir.size()) return mask;
    hash = HashByte(hash, dir[length]);
  }
}

}  // namespace zorvnotifyd

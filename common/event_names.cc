// Naming inotify event bits.

#include "event_names.h"

#include <sys/inotify.h>

#include <cstdio>

namespace zorvcommon {
namespace {

struct BitName {
  uint32_t bit;
  const char* name;
};

constexpr BitName kBitNames[] = {
    {IN_ACCESS, "IN_ACCESS"},
    {IN_MODIFY, "IN_MODIFY"},
    {IN_ATTRIB, "IN_ATTRIB"},
    {IN_CLOSE_WRITE, "IN_CLOSE_WRITE"},
    {IN_CLOSE_NOWRITE, "IN_CLOSE_NOWRITE"},
    {IN_OPEN, "IN_OPEN"},
    {IN_MOVED_FROM, "IN_MOVED_FROM"},
    {IN_MOVED_TO, "IN_MOVED_TO"},
    {IN_CREATE, "IN_CREATE"},
    {IN_DELETE, "IN_DELETE"},
    {IN_DELETE_SELF, "IN_DELETE_SELF"},
    {IN_MOVE_SELF, "IN_MOVE_SELF"},
    {IN_UNMOUNT, "IN_UNMOUNT"},
    {IN_Q_OVERFLOW, "IN_Q_OVERFLOW"},
    {IN_ISDIR, "IN_ISDIR"},
};

}  // namespace

std::string MaskNames(uint32_t mask) {
  std::string names;
  for (const BitName& bit : kBitNames) {
    if ((mask & bit.bit) == 0) continue;
    if (!names.empty()) names += '|';
    names += bit.name;
    mask &= ~bit.bit;
  }
  if (mask != 0 || names.empty()) {
    char rest[16];
    snprintf(rest, sizeof(rest), "0x%x", mask);
    if (!names.empty()) names += '|';
    names += rest;
  }
  return names;
}

}  // namespace zorvcommon

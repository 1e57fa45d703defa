// The mount table of the daemon's own mount namespace, read once for a
// whole catalogue: telling which configured trees are mount points costs a
// lookup each instead of a path walk in the kernel each.
#ifndef ZORVNOTIFYD_DAEMON_MOUNT_TABLE_H_
#define ZORVNOTIFYD_DAEMON_MOUNT_TABLE_H_

#include <cstdint>
#include <string>
#include <string_view>
#include <unordered_map>
#include <unordered_set>

namespace zorvnotifyd {

class MountTable {
 public:
  // Reads /proc/self/mountinfo (at most 16 MiB of it); false, with |why|,
  // when it cannot be read whole.  The table is empty until then.
  bool Read(std::string* why);
  // Adds the mounts of |text|, in the form of /proc/self/mountinfo, with
  // the kernel's octal escapes ("\040" for a space) undone; a line that
  // does not have the fields skips.
  void Parse(std::string_view text);

  // True when some mount is mounted at |path|, as the table spells it: a
  // path that reaches a mount point through a symbolic link is not one.
  bool IsMountPoint(const std::string& path) const { return points_.count(path) != 0; }
  // The directory of its file system that mount |id| shows at its mount
  // point ("/" for the whole file system); null when no mount has |id|.
  const std::string* RootOf(uint64_t id) const;

 private:
  std::unordered_set<std::string> points_;
  std::unordered_map<uint64_t, std::string> roots_;  // by mount id
};

}  // namespace zorvnotifyd

#endif  // ZORVNOTIFYD_DAEMON_MOUNT_TABLE_H_

// The directory of the queues' journals, DIR/journal, and the id of what it
// holds: 32 hexadecimal digits that every reply carries.  The id is made
// when the directory has none (new, removed, or its id file unusable), and
// the directory is then emptied: sequence numbers of another id never
// apply.  A client that sees the id it stored may resume with "since".
#ifndef ZORVNOTIFYD_DAEMON_JOURNAL_DIR_H_
#define ZORVNOTIFYD_DAEMON_JOURNAL_DIR_H_

#include <string>

#include "state_dir.h"
#include "unique_fd.h"

namespace zorvnotifyd {

using zorvcommon::UniqueFd;

// 32 random hexadecimal digits.
std::string RandomId();

class JournalDir {
 public:
  // Opens the journal directory of |state| and its id.  False (logged)
  // when the directory cannot be used: the daemon then runs without
  // journals, with a new id at each start.
  bool Open(const StateDir& state);

  // A new id, written in place of the old: the numbering of some queue
  // was lost, so no "since" of the old id holds.
  const std::string& Renew();

  // The directory (-1 when not usable) and the id (always set after Open).
  int fd() const { return fd_.get(); }
  const std::string& id() const { return id_; }

 private:
  // Removes every file of the directory (not subdirectories).
  void Empty();
  // Writes |id_| to the id file, through a temporary file renamed in
  // place, synced; false (logged) on failure: the journals are kept, and
  // the next start makes a new id.
  bool WriteId();

  UniqueFd fd_;
  std::string id_;
};

}  // namespace zorvnotifyd

#endif  // ZORVNOTIFYD_DAEMON_JOURNAL_DIR_H_

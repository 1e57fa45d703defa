// The platform layer: the system services the library needs, behind the
// names the library calls them by.  Nothing here logs; failures reach the
// library through results and the last-error accessors.  None of these
// symbols is exported from the library.
#ifndef ZORVNOTIFYD_SRC_PLATFORM_PLATFORM_H_
#define ZORVNOTIFYD_SRC_PLATFORM_PLATFORM_H_

#include <sys/types.h>

#include <string>

#include <json/json.h>

#include "platform/scoped.h"

// Non-zero when a directory exists at |path|, 0 otherwise.
int ZORBCFileCheckDir(const char* path);

// Creates the directory |path| with |mode|; with |parents| non-zero, missing
// parent directories are created with the same mode first.  |reserved|,
// |owner_uid| and |owner_gid| are accepted for compatibility and unused.
// Returns 0 on success (also when the directory exists), non-zero otherwise.
int ZORVFSMkdirP(const char* path, const void* reserved, int parents, int owner_uid, int owner_gid,
                 mode_t mode);

// 1 when stat() succeeds on |path|, whatever the file's type; 0 otherwise.
int ZORBCFileExist(const char* path);

// Asks systemd to start (or stop) the service |name| without waiting for the
// job: runs "/usr/bin/systemctl --no-block start|stop NAME" with real,
// effective and saved ids 0, a fixed minimal environment, standard streams
// on /dev/null and no other inherited descriptor, and waits at most 10 s for
// it.  |flags| is accepted for compatibility and unused.  Returns 0 when
// systemctl exited with status 0; otherwise -1, with the reason recorded as
// the last platform error.
int ZORBServiceStart(const char* name, int flags);
int ZORBServiceStop(const char* name, int flags);

// The last platform error recorded in this thread: its code, and the source
// file and line that recorded it.  Code 0, file "" and line 0 when none.
unsigned int ZORBCErrGet();
const char* ZORBCErrorGetFile();
int ZORBCErrorGetLine();

namespace ZORV {
namespace ZORVNOTIFYD {
namespace platform {

// Codes of the platform errors recorded by this layer.
enum ErrorCode : unsigned int {
  kErrNone = 0,
  kErrSpawn = 0x0101,       // fork or pidfd setup failed
  kErrWait = 0x0102,        // waiting for the child failed
  kErrTimeout = 0x0103,     // the child ran too long and was killed
  kErrExitStatus = 0x0200,  // ORed with the child's exit status (0..255)
  kErrKilled = 0x0400,      // ORed with the signal that ended the child
};

// Records a platform error; used through ZORB_SET_ERROR.
void SetLastError(unsigned int code, const char* file, int line);
#ifdef __FILE_NAME__
#define ZORB_SET_ERROR(code) \
  ::ZORV::ZORVNOTIFYD::platform::SetLastError((code), __FILE_NAME__, __LINE__)
#else
#define ZORB_SET_ERROR(code) ::ZORV::ZORVNOTIFYD::platform::SetLastError((code), __FILE__, __LINE__)
#endif

// The largest file ReadRegularFile (and so JsonFromFile) reads, in bytes:
// 16 MiB, far more than any catalogue needs, and a bound on the memory and
// time a load can take.
constexpr size_t kMaxJsonFileSize = size_t{16} << 20;

// Replaces |text| with the bytes of the file at |path| (links are followed).
// The file is opened without blocking and only a regular file is read, and
// never more than one byte past kMaxJsonFileSize.  False, with |text|
// unchanged, when the file cannot be opened or read, is not a regular file
// (a fifo, a device, a directory) or holds more than kMaxJsonFileSize bytes.
bool ReadRegularFile(const std::string& path, std::string& text);

// Replaces |value| with the one JSON value |text| holds, read as the queue
// files are: comments allowed, nothing but whitespace and comments after
// the value.  False, with |value| unchanged, when |text| is not such a text
// (an empty text included).
bool JsonFromText(Json::Value& value, const std::string& text);

// Replaces |value| with the JSON text of the file at |path| (links are
// followed): ReadRegularFile, then JsonFromText.  The whole file must be one
// valid JSON value: an empty file or trailing garbage fails.  False when
// the file cannot be read or is not valid JSON, and also, without blocking
// or reading it, when it is not a regular file (a fifo, a device, a
// directory) or holds more than kMaxJsonFileSize bytes.
bool JsonFromFile(Json::Value& value, const std::string& path);

// Writes |value| as JSON text to |path| atomically and durably: a temporary
// file (mode 0600, name beginning with ".") in the same directory is
// written, synced and renamed over |path|, and the directory is synced.
// Readers see the old file or the new one, never a mix.  Temporary files
// left by a writer that died are removed by the next completed write to the
// same path.  On success |written| holds a descriptor of the file that was
// renamed into place, so that the caller can act on that very file whatever
// |path| names by then.  False on failure, with the target untouched and
// |written| unchanged; in particular, without writing anything, when the
// text is longer than kMaxJsonFileSize bytes (JsonFromFile would refuse it).
bool JsonToFile(const Json::Value& value, const std::string& path, ScopedFd& written);

}  // namespace platform
}  // namespace ZORVNOTIFYD
}  // namespace ZORV

#endif  // ZORVNOTIFYD_SRC_PLATFORM_PLATFORM_H_

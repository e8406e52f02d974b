// Shared by the sources of the development platform: the sandbox root, the
// last-error record, the fault-switch check and a whole-file reader. Nothing
// here is exported from the library.
#ifndef VELT_LINUX_DEV_INTERNAL_H
#define VELT_LINUX_DEV_INTERNAL_H

#include <sys/stat.h>

#include <json/value.h>

#include <string>

namespace velt_dev {

// The sandbox root without a trailing '/'; "" when PLOVO_ROOT is unset,
// empty or "/", so that Root() + "/x" is always the rooted form of "/x".
std::string Root();
// Root() + "/velt-dev".
std::string StateDir();

// The calling thread's last platform error.
void SetLastError(int code, const char* file, int line);
int LastErrorCode();
const char* LastErrorFile();
int LastErrorLine();

// True when the fault switch of `call` fires for this call; the last error
// then holds the switch's code.
bool FaultHit(const char* call, const char* file, int line);

// The largest file ReadWholeFile reads. Every file the platform reads (key
// and pid files, its JSON state) holds a few lines; anything bigger is not
// one of them.
constexpr off_t kMaxFileSize = 1 << 20;

// Reads the whole file into *out and, when st is not null, its stat.
// Returns 0 or the errno of the failing step: EINVAL for anything but a
// regular file (a FIFO, a device, a folder; never waited for), EFBIG for a
// file over kMaxFileSize.
int ReadWholeFile(const std::string& path, std::string* out, struct stat* st);

// Replaces file by data through a temporary file in the same folder, so
// that a reader sees the old or the new content, never a part. old is the
// stat of the file being replaced (its mode and owner are kept), null for a
// new file (0644). On failure sets the last error (VLIBC_ERR_NOT_FOUND when
// the folder is missing, else VLIBC_ERR_IO) and returns false.
bool ReplaceFile(const std::string& file, const std::string& data, const struct stat* old);

// Reads the JSON document of the state file StateDir() + "/" + name, in
// strict mode. Returns 1 when read, 0 when the file is missing, and -1 when
// it cannot be read or is not valid JSON.
int ReadJsonState(const std::string& name, Json::Value* root);

}  // namespace velt_dev

#ifdef __FILE_NAME__
#define VELT_SOURCE_NAME __FILE_NAME__
#else
#define VELT_SOURCE_NAME __FILE__
#endif

// Records a failure at the current line of the platform source.
#define VELT_FAIL(code) ::velt_dev::SetLastError((code), VELT_SOURCE_NAME, __LINE__)
// The entry check of every platform call: the switch is named after the
// calling function.
#define VELT_FAULT_HIT() ::velt_dev::FaultHit(__func__, VELT_SOURCE_NAME, __LINE__)

#endif

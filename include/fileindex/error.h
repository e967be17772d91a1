// Error codes and the process-wide error slot.
#ifndef FILEINDEX_ERROR_H
#define FILEINDEX_ERROR_H

namespace TAVO {
namespace FILEINDEX {

// Codes clients read after an operation returned failure. Stored as a plain
// 32-bit integer; values outside the list are kept unchanged.
enum _tag_fileindex_err_ {
  FILEINDEX_ERR_NONE = 0,
  FILEINDEX_ERR_BAD_PARAM = 1,
  FILEINDEX_ERR_BAD_PATH = 2,
  FILEINDEX_ERR_RESERVED = 3,  // never set by this library
  FILEINDEX_ERR_NO_SUCH_FOLDER = 4,
  FILEINDEX_ERR_EXCEED_MAX_FOLDER = 5,
  FILEINDEX_ERR_LOAD_CONFIG = 6,
  FILEINDEX_ERR_SAVE_CONFIG = 7,
  FILEINDEX_ERR_MALFORMED_CONFIG = 8,
  FILEINDEX_ERR_LOCK = 9,
  FILEINDEX_ERR_MAX_ = 0x7fffffff  // keeps the enumeration 32 bits wide for any stored value
};

class ErrorHandler {
 public:
  // The last code set by any failing operation of the process. Never cleared on success.
  static _tag_fileindex_err_ g_error_code;

  // Returns g_error_code.
  static _tag_fileindex_err_ GetError();
  // Stores code in g_error_code; nothing else.
  static void SetError(_tag_fileindex_err_ code);
};

// Writable by clients; 7 switches the debug lines of the queue writer on.
extern int LOG_LEVEL;

}  // namespace FILEINDEX
}  // namespace TAVO

#endif

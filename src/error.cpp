#include <fileindex/error.h>

namespace TAVO {
namespace FILEINDEX {

_tag_fileindex_err_ ErrorHandler::g_error_code = FILEINDEX_ERR_NONE;

_tag_fileindex_err_ ErrorHandler::GetError() { return g_error_code; }

void ErrorHandler::SetError(_tag_fileindex_err_ code) { g_error_code = code; }

}  // namespace FILEINDEX
}  // namespace TAVO

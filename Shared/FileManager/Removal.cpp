// QSFileManager: recursive removal.
#include <cerrno>

#include "Shared/FileManager/QSFileManager.h"
#include "Platform/FileTree/RemoveTree.h"
#include "Shared/Support/QSError.h"
#include "Shared/Support/QSLog.h"

using platform::Error;
using platform::URL;

namespace {

constexpr char kRemoveItemFn[] = "-[QSFileManager removeItemAtURL:error:]";
constexpr char kRemoveErrorCallbackFn[] = "_removefile_error_callback";

// Called for every item the removal could not remove. Logs the failure and
// keeps the first error number in the int that `context` points at (ENOENT
// counts as a first error too); the removal always goes on.
platform::fs::RemovalDecision _removefile_error_callback(const platform::fs::RemovalState& state, const char* path, void* context) {
  int errnum = 0;
  if (state.errorNumber(&errnum) != 0) {
    QS_SYSLOG(kQSLogLevelError, kRemoveErrorCallbackFn,
              "removefile hit error for %s but we failed to get the error number", path);
    errnum = ENOENT;
  } else if (errnum != ENOENT) {
    QS_SYSLOG(kQSLogLevelError, kRemoveErrorCallbackFn, "removefile hit error for %s : %s", path, QSErrorText(errnum));
  }
  int* firstError = static_cast<int*>(context);
  if (firstError != nullptr && *firstError == 0) *firstError = errnum;
  return platform::fs::RemovalDecision::Proceed;
}

}  // namespace

bool QSFileManager::removeItemAtURL(const URL& url, Error* error) const {
  if (url.empty()) {
    return QSFail(error, QSPOSIXError(kRemoveItemFn, __LINE__, EFAULT, "nil url passed to -removeItemAtURL:error:"));
  }
  int firstError = 0;
  platform::fs::RemovalState state;
  if (int failure = state.setErrorCallback(_removefile_error_callback); failure != 0) {
    QS_SYSLOG(kQSLogLevelError, kRemoveItemFn, "removefile_state_set REMOVEFILE_STATE_ERROR_CALLBACK failed: %s",
              QSErrorText(failure));
  }
  if (int failure = state.setErrorContext(&firstError); failure != 0) {
    QS_SYSLOG(kQSLogLevelError, kRemoveItemFn, "removefile_state_set REMOVEFILE_STATE_ERROR_CONTEXT failed: %s",
              QSErrorText(failure));
  }
  int result = platform::fs::removeTree(url.fileSystemRepresentation(), state);
  if (result != 0 && result != ENOENT) {
    return QSFail(
        error, QSPOSIXError(kRemoveItemFn, __LINE__, result, "removefile of %@ failed: %s", url, QSErrorText(result)));
  }
  if (firstError == 0 || firstError == ENOENT) return true;
  return QSFail(error, QSPOSIXError(kRemoveItemFn, __LINE__, firstError, "removefile of %@ failed: %s", url,
                                    QSErrorText(firstError)));
}

#include "Shared/FileManager/DataProtection.h"

#include <sys/xattr.h>

#include <cerrno>
#include <cstring>

#include "Shared/FileManager/QSFileManager.h"

namespace platform::fs {

int getDataProtectionClass(int fd, int32_t* dataProtectionClass) {
  int32_t stored = 0;
  ssize_t size = fgetxattr(fd, kDataProtectionClassAttributeName, &stored, sizeof stored);
  if (size < 0) {
    if (errno != ENODATA) return errno;
    stored = kUnsetDataProtectionClass;
  } else if (static_cast<size_t>(size) != sizeof stored) {
    // Shorter than a class: not something this layer wrote.
    return ERANGE;
  }
  if (dataProtectionClass) *dataProtectionClass = stored;
  return 0;
}

int setDataProtectionClass(int fd, int32_t dataProtectionClass) {
  if (dataProtectionClass == kQSNoDataProtectionClass) return EINVAL;
  if (fsetxattr(fd, kDataProtectionClassAttributeName, &dataProtectionClass, sizeof dataProtectionClass, 0) != 0) {
    return errno;
  }
  return 0;
}

}  // namespace platform::fs

// Per-item data-protection classes.
//
// Linux has no data-protection classes of its own, so the file layer keeps
// the class of each file and directory in the extended attribute
// "user.com.vantrel.quilld.protection-class": the signed 32-bit class in
// native byte order, exactly 4 bytes. An item without the attribute has
// class 0. Both calls work on an open descriptor, so the class is read and set
// on exactly the item that was opened; a symbolic link cannot carry a class
// (opening one with O_NOFOLLOW already fails).
//
// Both functions return 0 on success or the error number of the failure; they
// leave errno unspecified and are safe to call from any thread.
#pragma once

#include <cstdint>

namespace platform::fs {

inline constexpr char kDataProtectionClassAttributeName[] = "user.com.vantrel.quilld.protection-class";
// The class of an item that was never given one.
inline constexpr int32_t kUnsetDataProtectionClass = 0;

// Reads the class of the item open at `fd` into *dataProtectionClass (written
// only on success). A stored value that is not exactly 4 bytes is refused
// with ERANGE; other failures are fgetxattr's (EBADF, ENOTSUP, ...).
[[nodiscard]] int getDataProtectionClass(int fd, int32_t* dataProtectionClass);

// Stores `dataProtectionClass` on the item open at `fd`, replacing any class
// it had. kQSNoDataProtectionClass (-1, "no class to set") is refused with
// EINVAL; other failures are fsetxattr's (EPERM on an immutable item, ENOTSUP
// where the file system has no user attributes). A failure leaves the stored
// class as it was.
[[nodiscard]] int setDataProtectionClass(int fd, int32_t dataProtectionClass);

}  // namespace platform::fs

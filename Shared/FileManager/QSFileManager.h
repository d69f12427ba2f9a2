// QSFileManager: the gateway through which the system lists, creates, copies,
// moves and removes files. Every failure is reported as a boolean (or an
// absent result) plus an error record.
//
// Out-parameter contract: an `error` argument is written if and only if the
// operation fails (createTemporaryDirectoryInDirectoryURL clears it at entry),
// and only when it is not null. Nothing throws. Every result must be looked
// at ([[nodiscard]]); a caller that deliberately does not casts it to void and
// says why.
//
// Thread safety: the shared instance is created once, safely under concurrent
// first calls, and never destroyed. The class holds no state; every operation
// keeps its state on its own call and may run on several threads at once.
#pragma once

#include <sys/stat.h>

#include <cstdint>
#include <functional>
#include <memory>
#include <optional>
#include <string>
#include <string_view>
#include <vector>

#include "Platform/Foundation/Error.h"
#include "Platform/Foundation/URL.h"
#include "Platform/Foundation/Value.h"

// One entry of a tree walk.
struct QSTraversalEntry {
  enum class Kind { DirectoryPre, DirectoryPost, RegularFile, SymbolicLink, Other };
  std::string path;         // root path followed by the path inside the tree
  Kind kind = Kind::Other;
  int errorNumber = 0;      // the error the walk met for this entry, 0 if none; a directory
                            // that cannot be read comes as DirectoryPost with its error
  struct stat status {};    // lstat of the item (for DirectoryPost: the one taken at DirectoryPre)
};

// What a tree holds, as counted by sizeOfItemAtURL: regular files and their
// bytes, directories, and every other item (links included).
struct QSItemSize {
  uint64_t files = 0;
  uint64_t bytes = 0;
  uint64_t directories = 0;
  uint64_t otherItems = 0;
  QSItemSize& operator+=(const QSItemSize& other) {
    files += other.files;
    bytes += other.bytes;
    directories += other.directories;
    otherItems += other.otherItems;
    return *this;
  }
};

// The file system that holds (or would hold) a path, and its room.
struct QSFileSystemSpace {
  uint64_t device = 0;        // st_dev of the nearest existing item
  std::string existingPath;   // that item: the path itself or its nearest existing ancestor
  uint64_t freeBytes = 0;     // bytes an unprivileged writer may still use
  uint64_t blockSize = 0;     // the unit in which files take room
};

// Per-entry step of a walk: return true to go on, false to stop (optionally
// writing *error).
using QSTraversalBlock = std::function<bool(const QSTraversalEntry& entry, platform::Error* error)>;

// Predicate of a guarded class change: given the current class, answer
// whether to change it.
using QSDataProtectionPredicate = std::function<bool(int32_t currentClass)>;

// "No class to set" for directory creation.
inline constexpr int32_t kQSNoDataProtectionClass = -1;

// Extended attributes kept on application bundles (user namespace).
inline constexpr char kQSPlaceholderAttributeName[] = "user.com.vantrel.quilld.placeholder";
inline constexpr char kQSInstallTypeAttributeName[] = "user.com.vantrel.quilld.installType";

// Names a move across file systems gives an item while it is under way: its
// copy beside the destination until it is complete and durable, and the
// source in its own directory once it has been set aside for removal.
inline constexpr char kQSMoveIncomingPrefix[] = ".qs-move-incoming.";
inline constexpr char kQSMoveOutgoingPrefix[] = ".qs-move-outgoing.";

namespace platform::fs {
struct CopyLinkTable;
}  // namespace platform::fs

// The moves of the items of one container, made one after the other as a
// set: names of one inode in different items stay names of one inode when
// they move to another file system, and QSFileManager::finishMoveGroup ends
// the set with one flush of each file system involved instead of one per
// item. Not shared between threads.
class QSMoveGroup {
 public:
  QSMoveGroup();
  ~QSMoveGroup();
  QSMoveGroup(const QSMoveGroup&) = delete;
  QSMoveGroup& operator=(const QSMoveGroup&) = delete;

 private:
  friend class QSFileManager;
  std::unique_ptr<platform::fs::CopyLinkTable> links_;
  // Moves across file systems whose source set aside is gone: the
  // directories it was removed from, and the copies that still carry the
  // move's ticket.
  std::vector<std::string> sourceDirectories_;
  std::vector<std::string> ticketedCopies_;
};

class QSFileManager {
 public:
  static QSFileManager& defaultManager();

  // --- Existence (lstat; a dangling link exists) ---------------------------
  [[nodiscard]] bool itemExistsAtURL(const platform::URL& url) const;
  [[nodiscard]] bool itemDoesNotExistAtURL(const platform::URL& url) const;

  // --- Listing -------------------------------------------------------------
  // The children in directory order ("." and ".." never listed). A symbolic
  // link is listed as a non-directory URL, or left out (with a level-5 line)
  // when `ignoringSymlinks`.
  [[nodiscard]] std::optional<std::vector<platform::URL>> urlsForItemsInDirectoryAtURL(
      const platform::URL& url, bool ignoringSymlinks, platform::Error* error = nullptr) const;

  // --- Removal (recursive, never follows links; absent items succeed) -------
  [[nodiscard]] bool removeItemAtURL(const platform::URL& url, platform::Error* error = nullptr) const;

  // --- Directory creation ---------------------------------------------------
  [[nodiscard]] bool createDirectoryAtURL(const platform::URL& url, bool withIntermediateDirectories, mode_t mode,
                            int32_t dataProtectionClass, platform::Error* error = nullptr) const;
  [[nodiscard]] bool createDirectoryAtURL(const platform::URL& url, bool withIntermediateDirectories, mode_t mode,
                            platform::Error* error = nullptr) const;

  // --- Copy and move ---------------------------------------------------------
  // Copy carries data, extended attributes (ACLs included), mode, owner, group
  // and times of every item and copies links as links. Move renames, or on
  // EXDEV copies into a hidden sibling of the destination, makes the copy
  // durable, renames it into place and only then sets the source aside and
  // removes it (see CopyMove.cpp): an item is complete at one path or the
  // other at every instant, whether the process is killed or the power fails.
  [[nodiscard]] bool _copyItemAtURL(const platform::URL& src, const platform::URL& dst, bool failIfSrcMissing,
                      platform::Error* error = nullptr) const;
  [[nodiscard]] bool _moveItemAtURL(const platform::URL& src, const platform::URL& dst, bool failIfSrcMissing,
                      platform::Error* error = nullptr) const;
  [[nodiscard]] bool copyItemIfExistsAtURL(const platform::URL& src, const platform::URL& dst,
                             platform::Error* error = nullptr) const;
  [[nodiscard]] bool copyItemAtURL(const platform::URL& src, const platform::URL& dst, platform::Error* error = nullptr) const;
  [[nodiscard]] bool moveItemIfExistsAtURL(const platform::URL& src, const platform::URL& dst,
                             platform::Error* error = nullptr) const;
  [[nodiscard]] bool moveItemAtURL(const platform::URL& src, const platform::URL& dst, platform::Error* error = nullptr) const;
  // The same as a member of `group` (see QSMoveGroup).
  [[nodiscard]] bool moveItemIfExistsAtURL(const platform::URL& src, const platform::URL& dst, QSMoveGroup& group,
                                           platform::Error* error = nullptr) const;
  // Ends the moves of `group`: when some went to another file system, makes
  // the removal of their sources durable, takes the move's ticket off their
  // copies and flushes the file system of those. False when a flush fails.
  [[nodiscard]] bool finishMoveGroup(QSMoveGroup& group, platform::Error* error = nullptr) const;
  // Cleans what an interrupted move of `src` to `dst` across file systems
  // left: the source set aside (recognised by the mark the move gave it,
  // which names the ticket of its copy) is removed when the destination is
  // that copy, kept otherwise (false, with a level-3 line); an item of that
  // name without the mark is not a leftover and stays. An unfinished hidden
  // copy is removed while the source is in place. Callers run it before they
  // look at `src`; without leftovers it only looks at three names.
  [[nodiscard]] bool finishInterruptedMoveOfItemAtURL(const platform::URL& src, const platform::URL& dst,
                                        platform::Error* error = nullptr) const;
  // Whether `name` is one that a move across file systems gives an item
  // while it is under way.
  static bool isInterruptedMoveItemName(std::string_view name);

  // --- Durability ---------------------------------------------------------------
  // Flushes the entries of the directory at `url` (fsync), so that what was
  // moved into or out of it survives a power cut. A link at the path fails.
  bool synchronizeDirectoryAtURL(const platform::URL& url, platform::Error* error = nullptr) const;
  // --- Temporary directories ("temp.XXXXXX", mode 0700) ----------------------
  [[nodiscard]] std::optional<platform::URL> createTemporaryDirectoryInDirectoryURL(const platform::URL& parent,
                                                                      platform::Error* error = nullptr) const;

  // --- Status of one item (lstat; a final symbolic link is not followed) ------
  // Sets *isLink (when not null) to whether the item at `url` is itself a
  // symbolic link. Fails with a POSIX record whose code is lstat's errno.
  [[nodiscard]] bool isSymbolicLinkAtURL(const platform::URL& url, bool* isLink,
                                         platform::Error* error = nullptr) const;

  // --- Tree walk, ownership, symbolic links -----------------------------------
  // Hands every entry of the tree at `root` to `withBlock` (directories before
  // and after their contents), never following a link and never leaving the
  // root's file system. Stops at the first entry the walk cannot stat (POSIX
  // record) or the step refuses (the step's record, if it wrote one). Nothing
  // is logged. A missing step only visits.
  [[nodiscard]] bool _traverseDirectory(const platform::URL& root, platform::Error* error, const QSTraversalBlock& withBlock) const;
  // Gives every item of the tree `toUID`:`GID`, directories mode 0755 and the
  // rest 0644 (a link's own mode is left as it is: Linux cannot change it).
  // Items that cannot be changed are logged and passed over; with
  // `validateSymlinks`, a link that leads outside the tree stops the walk with
  // code 70. Changes made before a failure stay.
  [[nodiscard]] bool standardizeOwnershipAtURL(const platform::URL& url, uint32_t toUID, uint32_t GID, bool validateSymlinks,
                                 platform::Error* error = nullptr) const;
  [[nodiscard]] bool createSymbolicLinkAtURL(const platform::URL& url, const platform::URL& withDestinationURL,
                               platform::Error* error = nullptr) const;
  // The link's text (at most 1024 bytes) as an unresolved URL.
  [[nodiscard]] std::optional<platform::URL> destinationOfSymbolicLinkAtURL(const platform::URL& url,
                                                              platform::Error* error = nullptr) const;

  // --- Sizes and room (read only) -----------------------------------------------
  // Counts the tree at `url` (a file counts itself; a missing item is empty),
  // not following links and not leaving its file system. Fails with a POSIX
  // record when part of the tree cannot be read.
  bool sizeOfItemAtURL(const platform::URL& url, QSItemSize* size, platform::Error* error = nullptr) const;
  // The file system of `url`, or of its nearest existing ancestor when it
  // does not exist yet, with its free room.
  bool fileSystemSpaceForURL(const platform::URL& url, QSFileSystemSpace* space,
                             platform::Error* error = nullptr) const;
  // The device `url` itself lies on (links not followed): true with none when
  // nothing is there, false with `error` when its status cannot be read.
  bool deviceOfItemAtURL(const platform::URL& url, std::optional<uint64_t>* device,
                         platform::Error* error = nullptr) const;

  // --- Path containment ---------------------------------------------------------
  // The real path of `url` when it lies inside `ifChildOfURL` (links resolved,
  // missing tails tolerated), or none with one level-3 line saying why. An
  // empty URL stands for a missing argument.
  [[nodiscard]] std::optional<platform::URL> realPathForURL(const platform::URL& url, const platform::URL& ifChildOfURL) const;
  [[nodiscard]] std::optional<platform::URL> _realPathForURL(const platform::URL& url, bool allowNonExistentPathComponents) const;
  [[nodiscard]] std::optional<platform::URL> _realPathWhatExistsInPath(const std::string& path) const;
  // Whether `url` lies strictly inside `base` (or is `base` itself, when
  // `orIsBase`), judged by where every existing part of both leads, so that a
  // link on the way out of the base is caught. Relative and empty paths and
  // paths with a ".." component are refused. Nothing is logged: the caller
  // says what the path was for.
  [[nodiscard]] bool urlLiesInsideURL(const platform::URL& url, const platform::URL& base, bool orIsBase = false) const;
  // The two halves of urlLiesInsideURL, for a caller that holds one path
  // against many: the path resolved as it does (none when unusable), and the
  // comparison of two such paths (false when either is none).
  [[nodiscard]] std::optional<std::string> resolvedPathOfURL(const platform::URL& url) const;
  [[nodiscard]] bool resolvedPathLiesInside(const std::optional<std::string>& path,
                                            const std::optional<std::string>& base, bool orIsBase = false) const;
  // A null path pointer stands for a missing path.
  [[nodiscard]] bool _validateSymlink(const std::string* path, uint32_t withStartingDepth, uint32_t* andEndingDepth) const;

  // --- Data-protection classes and extended attributes ------------------------
  // Classes are read and set through a descriptor opened without following a
  // link (a link at the path fails the open). Attribute calls work on the item
  // at the path itself; attribute write and read failures are logged records
  // of code 4 with the POSIX error underneath. A missing install type reads 0;
  // bundleAtURLIsPlaceholder never fails and never logs.
  [[nodiscard]] bool dataProtectionClassOfItemAtURL(const platform::URL& url, int32_t* dataProtectionClass,
                                      platform::Error* error = nullptr) const;
  [[nodiscard]] bool setDataProtectionClassOfItemAtURL(const platform::URL& url, int32_t toClass,
                                         const QSDataProtectionPredicate& ifPredicate,
                                         platform::Error* error = nullptr) const;
  [[nodiscard]] bool markBundleAsPlaceholder(const platform::URL& bundle, platform::Error* withError = nullptr) const;
  [[nodiscard]] bool bundleAtURLIsPlaceholder(const platform::URL& bundle) const;
  [[nodiscard]] bool setInstallType(const platform::Value& installType, const platform::URL& onBundle,
                      platform::Error* error = nullptr) const;
  [[nodiscard]] std::optional<platform::Value> installTypeForBundle(const platform::URL& bundle,
                                                      platform::Error* error = nullptr) const;

  // --- Store data ----------------------------------------------------------------
  // Copies or moves the four store items (those present) from `source` into
  // the existing `toDirectory`. Each failure is logged (code 24, keyed by the
  // item); it ends the capture only when `failureIsFatal`. Nothing is undone.
  [[nodiscard]] bool captureStoreDataFromDirectory(const platform::URL& source, const platform::URL& toDirectory, bool doCopy,
                                     bool failureIsFatal, platform::Error* withError = nullptr) const;

 private:
  QSFileManager() = default;
  bool _moveItem(const platform::URL& src, const platform::URL& dst, bool failIfSrcMissing, QSMoveGroup* group,
                 platform::Error* error) const;
  bool _moveItemAcrossFileSystems(const platform::URL& src, const platform::URL& dst, QSMoveGroup* group,
                                  platform::Error* error) const;
};

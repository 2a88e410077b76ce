// SLFileManager: the file-system layer that every other part of the system
// goes through.
//
// It works at the level of POSIX calls, not through a high-level file API, so
// that each failure carries the exact errno and a message naming the call that
// failed. Every operation follows the same conventions:
//
//  - An operation that can fail returns a success flag, or a result that is
//    absent on failure, and takes an optional error out-slot (sl::Error*) as
//    its last argument. The slot may be null; when it is not, it is written
//    only when the operation fails. On success it is left as the caller set
//    it, and a result is defined only on success.
//  - A record's "FunctionName" is the operation's documented name, e.g.
//    "-[SLFileManager removeItemAtURL:error:]", and its "SourceFileLine" the
//    line of the site that made it (Support/Errors.h).
//  - When a system call fails, the record is in sl::kPOSIXErrorDomain with
//    the call's errno (or the error number it returned) as the code, and the
//    message names the call: "removefile of %@ failed: %s". Failures that the
//    layer's own checks detect use SLInstallerErrorDomain with the codes of
//    Support/Errors.h.
//  - Diagnostics go to the installer log (Support/Log.h, threshold rule
//    applied) under the operation's documented name. Per-entry callbacks log
//    under the name of the operation that owns them, except the removal's
//    error callback, which logs as "_removefile_error_callback".
//  - In messages "%@" prints a URL as its URL string, "%s" a file-system path
//    or a strerror text.
//  - Symbolic links are never followed where the link could be the item
//    itself.
//
// The class has no instance state: one shared instance per process, made on
// first use and never destroyed. Operations keep nothing between calls, so
// any thread may call any of them at any time.
#pragma once

#include <fts.h>
#include <sys/types.h>

#include <cstdint>
#include <functional>
#include <optional>
#include <string>
#include <vector>

#include "Platform/Error.h"
#include "Platform/URL.h"
#include "Platform/Value.h"

class SLFileManager {
 public:
  // The shared instance; created once, thread-safely, on the first call.
  static SLFileManager& defaultManager();

  SLFileManager(const SLFileManager&) = delete;
  SLFileManager& operator=(const SLFileManager&) = delete;

  // Removes a file, a symbolic link (never its target) or a whole directory
  // tree. An item that is already gone counts as removed; so does an entry
  // that vanishes while the tree is being removed. A failed removal may have
  // removed part of the tree; nothing is restored. A null URL fails with
  // EFAULT.
  [[nodiscard]] bool removeItemAtURL(const sl::URL& url, sl::Error* error = nullptr);

  // The URLs of the directory's immediate children ("." and ".." left out),
  // in the order the directory stream yields them. A child directory's URL
  // is a directory URL; every other entry's (links included) is not. With
  // ignoringSymlinks, links are left out, each with a notice line. The
  // directory itself is opened without following a link: a path that is a
  // link, or not a directory, fails.
  std::optional<std::vector<sl::URL>> urlsForItemsInDirectoryAtURL(const sl::URL& url, bool ignoringSymlinks,
                                                                   sl::Error* error = nullptr);

  // Both tests lstat the path, so a dangling link counts as an item. They
  // are not each other's negation: when the state of the path cannot be
  // determined (anything but success or ENOENT) both answer false and log
  // one error line. Ask itemDoesNotExistAtURL to be sure a path is free, and
  // itemExistsAtURL to be sure something is there.
  bool itemExistsAtURL(const sl::URL& url);
  bool itemDoesNotExistAtURL(const sl::URL& url);

  // ---- Directory creation, copy, move and temporary directories ----

  // Creates the directory (with missing parents when asked) with `mode`; an
  // item that already stands at the path is no failure. With a
  // protectionClass other than -1 the class is then set on the directory,
  // whether it was made now or stood there already.
  bool createDirectoryAtURL(const sl::URL& url, bool withIntermediateDirectories, mode_t mode,
                            int32_t protectionClass, sl::Error* error = nullptr);
  bool createDirectoryAtURL(const sl::URL& url, bool withIntermediateDirectories, mode_t mode,
                            sl::Error* error = nullptr);

  // Copy and move of whole items, links as links. The IfExists forms treat
  // a missing source as nothing to do; the plain forms fail with ENOENT. A
  // move is one rename on one volume; across volumes (EXDEV, and only then)
  // it copies and removes the source.
  bool copyItemIfExistsAtURL(const sl::URL& source, const sl::URL& destination, sl::Error* error = nullptr);
  bool moveItemIfExistsAtURL(const sl::URL& source, const sl::URL& destination, sl::Error* error = nullptr);
  bool copyItemAtURL(const sl::URL& source, const sl::URL& destination, sl::Error* error = nullptr);
  bool moveItemAtURL(const sl::URL& source, const sl::URL& destination, sl::Error* error = nullptr);

  // A new directory "temp.XXXXXX" (mode 0700) in `parent`; null on failure.
  // Unlike every other operation, this one clears the error slot on entry.
  sl::URL createTemporaryDirectoryInDirectoryURL(const sl::URL& parent, sl::Error* error = nullptr);

  // ---- Symbolic links, real paths and the containment check ----

  bool createSymbolicLinkAtURL(const sl::URL& url, const sl::URL& withDestinationURL, sl::Error* error = nullptr);
  // The link's content as a file URL, unresolved; null on failure.
  sl::URL destinationOfSymbolicLinkAtURL(const sl::URL& url, sl::Error* error = nullptr);

  // The real path of `url` when it lies inside `ifChildOfURL`, else null
  // (each refusal is one error line in the installer log).
  sl::URL realPathForURL(const sl::URL& url, const sl::URL& ifChildOfURL);

  // ---- Bundle markers in extended attributes ----

  // Two attributes of the bundle directory itself, never of a link's target
  // (Linux refuses user attributes on a link: EPERM to a write, absent to a
  // read): "com.vantor.stowd.placeholder", 4 bytes holding 1, and
  // "com.vantor.stowd.installType", 8 bytes; both little-endian. A failure is
  // a logged record in SLInstallerErrorDomain, code 4, with the bare POSIX
  // record of errno as its underlying error when a call failed.
  bool markBundleAsPlaceholder(const sl::URL& url, sl::Error* withError = nullptr);
  // True exactly when a 4-byte placeholder value is there (its bytes are not
  // looked at); every failure answers false, unlogged.
  bool bundleAtURLIsPlaceholder(const sl::URL& url);
  bool setInstallType(const sl::Number& installType, const sl::URL& onBundle, sl::Error* error = nullptr);
  // The install type (0 when the attribute is absent); null on failure.
  sl::Number installTypeForBundle(const sl::URL& url, sl::Error* error = nullptr);

  // ---- Store data capture ----

  // The store metadata items, in the order they are captured: "Manifest.plist",
  // "JukoraArtwork", "JukoraMetadata.plist", "GeoJSON". This is the one list
  // of those names: the configuration answers this same list as its bundle
  // metadata item names.
  static const std::vector<std::string>& storeDataItemNames();

  // Carries the store metadata items (storeDataItemNames()) from one
  // directory into another, each by itself, by copy or by move. A missing
  // item is not carried and is no failure. A failing item leaves one logged
  // record (SLInstallerErrorDomain, code 24, "LegacyErrorString" naming the
  // item); with failureIsFatal it ends the capture and is returned, items
  // carried before it staying where they went; without, the capture goes on
  // and succeeds.
  bool captureStoreDataFromDirectory(const sl::URL& source, const sl::URL& toDirectory, bool doCopy,
                                     bool failureIsFatal, sl::Error* withError = nullptr);

  // ---- Data protection classes ----

  // Both open the item itself (a link fails at the open with ELOOP) and
  // report failures as POSIX records, unlogged.
  bool dataProtectionClassOfItemAtURL(const sl::URL& url, int32_t* protectionClass, sl::Error* error = nullptr);
  // Answers whether to change an item whose class is currently `current`.
  using ProtectionClassPredicate = std::function<bool(int32_t current)>;
  // An empty predicate changes the class unconditionally. A predicate is
  // called once, with the class read just before; when it declines, the
  // class stays and the operation succeeds.
  bool setDataProtectionClassOfItemAtURL(const sl::URL& url, int32_t toClass, const ProtectionClassPredicate& ifPredicate,
                                         sl::Error* error = nullptr);

  // ---- Traversal and ownership standardisation ----

  // Brings a tree to one owner and to modes 0755 (directories) and 0644
  // (everything else); with validateSymlinks, a link whose real location is
  // not inside the root stops the walk.
  bool standardizeOwnershipAtURL(const sl::URL& url, uid_t toUID, gid_t GID, bool validateSymlinks,
                                 sl::Error* error = nullptr);

 private:
  SLFileManager() = default;

  // One entry as the directory stream yields it. `name` is `nameLength`
  // bytes (NUL-terminated too); `type` is DT_UNKNOWN, DT_DIR, DT_REG, DT_LNK
  // or another DT_ value that the stream reported.
  struct DirectoryEntry {
    const char* name;
    uint16_t nameLength;
    uint8_t type;
  };
  // Answers true to go on with the next entry, false to stop.
  using DirectoryEntryCallback = std::function<bool(const DirectoryEntry&)>;

  // Hands each entry of the directory at `path` to `body`. The directory is
  // opened with O_NOFOLLOW|O_DIRECTORY, so a link or a non-directory is
  // refused. An entry whose type the stream leaves unknown is lstat'ed
  // (relative to the directory) and gets the type of its mode when that is a
  // directory, a link or a regular file. Returns 0 when the stream ended or
  // `body` stopped, else the errno of the open, the stream or the read that
  // failed.
  static int _IterateDirectory(const char* path, const DirectoryEntryCallback& body);

  bool _copyItemAtURL(const sl::URL& source, const sl::URL& destination, bool failIfSrcMissing, sl::Error* error);
  bool _moveItemAtURL(const sl::URL& source, const sl::URL& destination, bool failIfSrcMissing, sl::Error* error);

  // The lexical depth walk: ".." lowers the depth, "", "." and "/" leave it,
  // anything else raises it. Answers false as soon as it falls below the
  // starting depth; otherwise stores the final depth (when asked) and
  // answers true.
  bool _validateSymlink(const sl::String& path, int32_t withStartingDepth, int32_t* andEndingDepth);
  sl::URL _realPathForURL(const sl::URL& url, bool allowNonExistentPathComponents);
  sl::URL _realPathWhatExistsInPath(const sl::String& path);

  // Hands every entry of a physical walk (links reported, never followed;
  // the walk stays on the root's volume) to `withBlock`, directories before
  // and after their contents. The callback answers false to stop, and may
  // leave a record in the slot it is given.
  using TraversalCallback = std::function<bool(FTSENT* entry, sl::Error* error)>;
  bool _traverseDirectory(const sl::URL& url, sl::Error* error, const TraversalCallback& withBlock);

  friend class SLFileManagerTestAccess;
};

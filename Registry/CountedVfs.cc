#include "Registry/CountedVfs.h"

#ifdef STOWLINE_FAULT_INJECTION

#include <sqlite3.h>

#include <array>
#include <cerrno>
#include <cstddef>
#include <cstdlib>

#include "Platform/Mutations.h"

namespace rg {

namespace {

constexpr char kVfsName[] = "stowline-counted";

// The default VFS, which does the work.
sqlite3_vfs* gBase = nullptr;

// The errno of the last call this VFS refused on this thread, for
// xGetLastError; 0 once a call went to the default VFS again.
thread_local int tLastRefused = 0;

// One open file: the wrapper SQLite sees, followed in the same allocation by
// the default VFS's file.
struct CountedFile {
  sqlite3_file base;
  sqlite3_file* real;
  const char* name;  // null for a temporary file, which is not counted
};

constexpr size_t kRealOffset = (sizeof(CountedFile) + alignof(std::max_align_t) - 1) & ~(alignof(std::max_align_t) - 1);

sqlite3_file* realOf(sqlite3_file* file) { return reinterpret_cast<CountedFile*>(file)->real; }

// 0 when the call may go ahead; else the errno it fails with.
int refusal(sl::mut::Kind kind, const char* name) {
  tLastRefused = 0;
  if (name == nullptr) return 0;
  const int code = sl::mut::admit(kind, name);
  if (code != 0) {
    tLastRefused = code;
    errno = code;
  }
  return code;
}

int counted(sqlite3_file* file, sl::mut::Kind kind, int ioError) {
  const int code = refusal(kind, reinterpret_cast<CountedFile*>(file)->name);
  if (code == 0) return SQLITE_OK;
  return code == ENOSPC || code == EDQUOT ? SQLITE_FULL : ioError;
}

int fileClose(sqlite3_file* file) {
  sqlite3_file* real = realOf(file);
  return real->pMethods ? real->pMethods->xClose(real) : SQLITE_OK;
}
int fileRead(sqlite3_file* file, void* bytes, int size, sqlite3_int64 offset) {
  return realOf(file)->pMethods->xRead(realOf(file), bytes, size, offset);
}
int fileWrite(sqlite3_file* file, const void* bytes, int size, sqlite3_int64 offset) {
  if (const int rc = counted(file, sl::mut::Kind::kWrite, SQLITE_IOERR_WRITE)) return rc;
  return realOf(file)->pMethods->xWrite(realOf(file), bytes, size, offset);
}
int fileTruncate(sqlite3_file* file, sqlite3_int64 size) {
  if (const int rc = counted(file, sl::mut::Kind::kTruncate, SQLITE_IOERR_TRUNCATE)) return rc;
  return realOf(file)->pMethods->xTruncate(realOf(file), size);
}
int fileSync(sqlite3_file* file, int flags) {
  if (const int rc = counted(file, sl::mut::Kind::kSync, SQLITE_IOERR_FSYNC)) return rc;
  return realOf(file)->pMethods->xSync(realOf(file), flags);
}
int fileSize(sqlite3_file* file, sqlite3_int64* size) { return realOf(file)->pMethods->xFileSize(realOf(file), size); }
int fileLock(sqlite3_file* file, int level) { return realOf(file)->pMethods->xLock(realOf(file), level); }
int fileUnlock(sqlite3_file* file, int level) { return realOf(file)->pMethods->xUnlock(realOf(file), level); }
int fileCheckReservedLock(sqlite3_file* file, int* out) {
  return realOf(file)->pMethods->xCheckReservedLock(realOf(file), out);
}
int fileControl(sqlite3_file* file, int op, void* arg) {
  return realOf(file)->pMethods->xFileControl(realOf(file), op, arg);
}
int fileSectorSize(sqlite3_file* file) { return realOf(file)->pMethods->xSectorSize(realOf(file)); }
int fileDeviceCharacteristics(sqlite3_file* file) {
  return realOf(file)->pMethods->xDeviceCharacteristics(realOf(file));
}
// The shared-memory index of the WAL is mapped memory, not file writes: it
// is passed through uncounted.
int fileShmMap(sqlite3_file* file, int region, int size, int extend, void volatile** out) {
  return realOf(file)->pMethods->xShmMap(realOf(file), region, size, extend, out);
}
int fileShmLock(sqlite3_file* file, int offset, int n, int flags) {
  return realOf(file)->pMethods->xShmLock(realOf(file), offset, n, flags);
}
void fileShmBarrier(sqlite3_file* file) { realOf(file)->pMethods->xShmBarrier(realOf(file)); }
int fileShmUnmap(sqlite3_file* file, int deleteFlag) {
  return realOf(file)->pMethods->xShmUnmap(realOf(file), deleteFlag);
}
int fileFetch(sqlite3_file* file, sqlite3_int64 offset, int size, void** out) {
  return realOf(file)->pMethods->xFetch(realOf(file), offset, size, out);
}
int fileUnfetch(sqlite3_file* file, sqlite3_int64 offset, void* page) {
  return realOf(file)->pMethods->xUnfetch(realOf(file), offset, page);
}

// The methods of a wrapped file claim the version of the wrapped file's
// methods, so that SQLite never calls one the default VFS lacks.
constexpr sqlite3_io_methods methodsOfVersion(int version) {
  return {
      .iVersion = version,
      .xClose = fileClose,
      .xRead = fileRead,
      .xWrite = fileWrite,
      .xTruncate = fileTruncate,
      .xSync = fileSync,
      .xFileSize = fileSize,
      .xLock = fileLock,
      .xUnlock = fileUnlock,
      .xCheckReservedLock = fileCheckReservedLock,
      .xFileControl = fileControl,
      .xSectorSize = fileSectorSize,
      .xDeviceCharacteristics = fileDeviceCharacteristics,
      .xShmMap = fileShmMap,
      .xShmLock = fileShmLock,
      .xShmBarrier = fileShmBarrier,
      .xShmUnmap = fileShmUnmap,
      .xFetch = fileFetch,
      .xUnfetch = fileUnfetch,
  };
}
constexpr std::array<sqlite3_io_methods, 3> kMethods = {methodsOfVersion(1), methodsOfVersion(2), methodsOfVersion(3)};

// Opening a named file that is not there yet with SQLITE_OPEN_CREATE is a
// creation and is counted (a journal, the WAL); temporary files are not.
int vfsOpen(sqlite3_vfs*, const char* name, sqlite3_file* file, int flags, int* outFlags) {
  auto* wrapper = reinterpret_cast<CountedFile*>(file);
  wrapper->base.pMethods = nullptr;
  wrapper->real = reinterpret_cast<sqlite3_file*>(reinterpret_cast<char*>(file) + kRealOffset);
  wrapper->real->pMethods = nullptr;
  const bool temporary = name == nullptr || (flags & SQLITE_OPEN_DELETEONCLOSE) != 0;
  wrapper->name = temporary ? nullptr : name;
  if (!temporary && (flags & SQLITE_OPEN_CREATE) != 0) {
    int there = 0;
    if (gBase->xAccess(gBase, name, SQLITE_ACCESS_EXISTS, &there) == SQLITE_OK && !there &&
        refusal(sl::mut::Kind::kCreate, name) != 0) {
      return SQLITE_CANTOPEN;
    }
  }
  tLastRefused = 0;
  const int rc = gBase->xOpen(gBase, name, wrapper->real, flags, outFlags);
  // The default VFS may leave methods behind on a failed open: SQLite then
  // still calls xClose, which must reach them.
  if (const sqlite3_io_methods* methods = wrapper->real->pMethods) {
    const int version = methods->iVersion < 1 ? 1 : methods->iVersion > 3 ? 3 : methods->iVersion;
    wrapper->base.pMethods = &kMethods[static_cast<size_t>(version - 1)];
  }
  return rc;
}

int vfsDelete(sqlite3_vfs*, const char* name, int syncDirectory) {
  if (refusal(sl::mut::Kind::kRemove, name) != 0) return SQLITE_IOERR_DELETE;
  return gBase->xDelete(gBase, name, syncDirectory);
}

int vfsGetLastError(sqlite3_vfs*, int size, char* text) {
  if (tLastRefused != 0) return tLastRefused;
  return gBase->xGetLastError ? gBase->xGetLastError(gBase, size, text) : 0;
}

sqlite3_vfs* registerCountedVfs() {
  gBase = sqlite3_vfs_find(nullptr);
  if (gBase == nullptr) return nullptr;
  // Everything but the calls that are counted stays the default VFS's own,
  // its application data included.
  static sqlite3_vfs vfs = *gBase;
  vfs.pNext = nullptr;
  vfs.zName = kVfsName;
  vfs.szOsFile = static_cast<int>(kRealOffset) + gBase->szOsFile;
  vfs.xOpen = vfsOpen;
  vfs.xDelete = vfsDelete;
  vfs.xGetLastError = vfsGetLastError;
  return sqlite3_vfs_register(&vfs, 0) == SQLITE_OK ? &vfs : nullptr;
}

}  // namespace

const char* countedVfsName() {
  static const sqlite3_vfs* const registered = registerCountedVfs();
  return registered ? kVfsName : nullptr;
}

}  // namespace rg

#endif  // STOWLINE_FAULT_INJECTION

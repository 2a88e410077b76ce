// Moving bundles into a new bundle container and back, in steps that
// recovery can repeat (see EmbeddedRegistry.h).
#pragma once

#include <string>

#include "Platform/Error.h"

namespace rg {

struct Move {
  std::string source;       // in the package
  std::string destination;  // in the new bundle container
};

// Where a source goes on its way out after a cross-volume copy:
// ".NAME.rgtrash" beside it.
std::string trashPathFor(const std::string& source);

// Renames the source to the destination; across volumes (EXDEV) copies it
// to ".NAME.partial" in the destination's directory, renames that into
// place, renames the source to its trash name and removes the trash. Each
// step counts for the crash seam. A copy that fails is removed again, so
// the call fails with the container as it was.
bool moveIntoContainer(const Move& move, sl::Error* error);

// Brings the source back when it is gone and the destination is there
// (rename, or across volumes a copy to ".NAME.rgrestore" beside the source
// renamed into place; removed again when the copy fails), then removes the
// trash. A source that is there is whole and is left alone. The
// destination's container is not removed here.
//
// The package (`packagePath`, the install's package directory) belongs to
// someone else and may have changed since the install: every step on the
// source's side works on a descriptor of the source's directory, opened
// without following a link at the package directory or below it (a
// placeholder's source is the package itself: then its directory is opened
// without following a link at its own name). When that directory is gone,
// is not a directory or is reached through a link, the destination is
// removed instead, as the package would have been, with the notice "Undo of
// the move of SOURCE: its directory is gone or reached through a link;
// removing DESTINATION".
bool undoMove(const Move& move, const std::string& packagePath, sl::Error* error);

// Removes the source's trash name, on the same descriptor as undoMove; a
// source directory that is gone or reached through a link holds none.
bool removeTrash(const Move& move, const std::string& packagePath, sl::Error* error);

// Removes a tree; absent (ENOENT, or ENOTDIR on the way) is success.
bool removeTree(const std::string& path, sl::Error* error);

}  // namespace rg

// A sentinel tree: a small tree outside a test's system root that no
// operation of the system may change. It is root-owned, with 0600 files,
// user.* extended attributes, a nested directory and a link; its state is
// recorded when it is made, and changes() names every item that differs.
//
//   sl::test::Sentinel sentinel;           // under /dev/shm
//   ... point links of the hostile tree at sentinel.path() ...
//   EXPECT_THAT(sentinel.changes(), IsEmpty());
#pragma once

#include <map>
#include <string>
#include <vector>

#include "TestSupport/TestSupport.h"

namespace sl::test {

class Sentinel {
 public:
  // The tree is made in a fresh directory under `parent` (which must be on
  // the volume of any tree that is to hard-link into it).
  explicit Sentinel(const char* parent = TempDir::kShm);

  // The top directory, and paths inside it: secret.txt (0600, two user.*
  // attributes), nested/ (0700, one attribute), nested/deep.txt (0600) and
  // link-to-secret (a relative link to secret.txt).
  const std::string& path() const { return dir_.path(); }
  std::string operator/(const std::string& relative) const { return dir_ / relative; }

  // One line per item that differs from the recorded state: "<path>:
  // missing", "<path>: added" or "<path>: was <state>, now <state>", the
  // state being mode, owner, size, modification time, attributes, a digest
  // of the contents or the link target, and the inode. Empty when nothing
  // changed.
  std::vector<std::string> changes() const;

 private:
  TempDir dir_;
  std::map<std::string, std::string> recorded_;
};

}  // namespace sl::test

// A sentinel tree: a small tree outside a test's system root that no
// operation of the system may change. It is made root-owned, with 0600
// files, user.* extended attributes, a nested directory and a link, and its
// state is recorded when it is made; changes() compares the tree as it is
// now with that record and names every difference.
//
//   sl::test::Sentinel sentinel;           // under /dev/shm
//   ... point links of the hostile tree at sentinel.path() ...
//   EXPECT_THAT(sentinel.changes(), IsEmpty());
#pragma once

#include <sys/types.h>

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

  // The sentinel's top directory, and paths inside it:
  //   secret.txt          0600 file with two user.* attributes
  //   nested/deep.txt     0600 file
  //   nested/             0700 directory with an attribute
  //   link-to-secret      relative link to secret.txt
  const std::string& path() const { return dir_.path(); }
  std::string operator/(const std::string& relative) const { return dir_ / relative; }

  // One line per difference between the tree now and the recorded state:
  // "<relative path>: <field> was <old>, now <new>", "<path>: missing",
  // "<path>: added". Empty when nothing changed.
  std::vector<std::string> changes() const;

  // The state of every item of the tree, by path relative to the top ("."
  // for the top itself), as "field=value" strings.
  using Snapshot = std::map<std::string, std::map<std::string, std::string>>;
  Snapshot snapshot() const;

 private:
  TempDir dir_;
  Snapshot recorded_;
};

}  // namespace sl::test

#!/bin/sh
# Fails, listing them, when a source of the library floors calls one of the
# system's mutating file operations directly instead of its sl::mut wrapper
# (Platform/Mutations.h). A genuine exception carries, on the same line, a
# comment "// not counted: <reason>".
#
# A call is the name followed by "(", written bare or as ::name, and not a
# member (".name", "->name"), another namespace's function ("sl::name"), a
# call without arguments (a member's "open()") or a declaration ("int name(",
# "Database> open("). open and openat count only when they are not visibly
# read-only: O_RDONLY or O_PATH on the line, or as the last argument a name
# that every assignment in the file sets read-only, and never O_CREAT or
# O_TRUNC.
#
# Usage: MutationsLint.sh <source root>
set -u
root=${1:?usage: MutationsLint.sh <source root>}
cd "$root" || exit 2

names='rename|renameat|renameat2|unlink|unlinkat|rmdir|mkdir|mkdirat|mkdtemp|mkstemp|mkostemp|creat|write|pwrite|writev|pwritev|ftruncate|truncate|fsync|fdatasync|syncfs|sync_file_range|fchmod|fchmodat|chmod|lchmod|fchown|fchownat|chown|lchown|utimensat|futimens|utimes|utime|setxattr|lsetxattr|fsetxattr|removexattr|lremovexattr|fremovexattr|symlink|symlinkat|link|linkat|copy_file_range|sendfile|fallocate|posix_fallocate|syscall|open|openat'
call="(^|[^A-Za-z0-9_.>:])(::)?($names)[[:space:]]*\\(([^)]|\$)"
declaration="(^|[^A-Za-z0-9_])(int|bool|void|ssize_t|long|[A-Za-z0-9_]*>)[[:space:]]+\\*?($names)[[:space:]]*\\("
readOnlyOpen="(^|[^A-Za-z0-9_.>:])(::)?(open|openat)[[:space:]]*\\(.*(O_RDONLY|O_PATH)"
creating='O_CREAT|O_TRUNC'
writable='O_CREAT|O_TRUNC|O_WRONLY|O_RDWR'

# Whether the open on this finding ("file:line:text") passes its flags as a
# name that is assigned only read-only flags in that file.
readOnlyFlagsName() {
  file=${1%%:*}
  name=$(printf '%s\n' "$1" | sed -nE 's/.*(open|openat)[[:space:]]*\(.*,[[:space:]]*([A-Za-z_][A-Za-z0-9_]*)[[:space:]]*\).*/\2/p')
  [ -n "$name" ] || return 1
  assignments=$(grep -E "(^|[^A-Za-z0-9_])$name[[:space:]]*=[^=]" "$file")
  [ -n "$assignments" ] || return 1
  ! printf '%s\n' "$assignments" | grep -qvE 'O_RDONLY|O_PATH' &&
    ! printf '%s\n' "$assignments" | grep -qE "$writable"
}

files=$(find Platform Support FileManager Configuration Registry AppMigrator \
          -type f \( -name '*.cc' -o -name '*.h' \) \
          ! -path Platform/Mutations.h ! -path Platform/Mutations.cc | sort)
[ -n "$files" ] || { echo "MutationsLint: no sources below $root" >&2; exit 2; }

# file:line:text, the exceptions out, the line comments cut off.
findings=$(grep -nE "$call" $files |
  grep -v '// not counted: ' |
  sed -E 's#//.*$##' |
  grep -E "^[^:]*:[0-9]+:.*$call" |
  grep -vE "$declaration" |
  while IFS= read -r line; do
    if printf '%s\n' "$line" | grep -qE "$readOnlyOpen" && ! printf '%s\n' "$line" | grep -qE "$creating"; then
      continue
    fi
    if printf '%s\n' "$line" | grep -qE "(^|[^A-Za-z0-9_.>:])(::)?(open|openat)[[:space:]]*\\(" && readOnlyFlagsName "$line"; then
      continue
    fi
    printf '%s\n' "$line"
  done)

if [ -n "$findings" ]; then
  echo "Mutating calls outside Platform/Mutations.h (call the sl::mut wrapper, or mark a genuine"
  echo "exception with \"// not counted: <reason>\" on the line):"
  printf '%s\n' "$findings"
  exit 1
fi
echo "MutationsLint: every mutating call goes through sl::mut"

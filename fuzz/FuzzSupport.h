// What the fuzz targets share: reporting a broken invariant, and bounding
// the walks over values a reader made.
#pragma once

#include <algorithm>
#include <cstddef>
#include <cstdio>
#include <cstdlib>
#include <string>

#include "Platform/Value.h"

namespace sl::fuzz {

// Reports a broken invariant and aborts, which the fuzzer records as a crash.
[[noreturn]] inline void failure(const char* target, const std::string& what) {
  std::fprintf(stderr, "%s: %s\n", target, what.c_str());
  std::abort();
}

// Whether the tree the value unfolds to stays within *budget (nodes plus the
// bytes of strings and data). A binary list may share one container from
// many places: cheap to read, exponential to walk.
inline bool unfoldsWithin(const Value& value, size_t* budget) {
  size_t cost = 1 + value.asString().length() + value.asData().size();
  if (cost > *budget) return false;
  *budget -= cost;
  if (Array array = value.asArray()) {
    for (const Value& element : array)
      if (!unfoldsWithin(element, budget)) return false;
  } else if (Dictionary dict = value.asDictionary()) {
    for (const auto& [key, element] : dict)
      if (!unfoldsWithin(element, budget)) return false;
  }
  return true;
}

// How many containers nest at the deepest place of the value (0 for a
// scalar). Walks the unfolded tree: call it on values unfoldsWithin bounds.
inline int nesting(const Value& value) {
  int deepest = 0;
  if (Array array = value.asArray()) {
    for (const Value& element : array) deepest = std::max(deepest, nesting(element));
    return deepest + 1;
  }
  if (Dictionary dict = value.asDictionary()) {
    for (const auto& [key, element] : dict) deepest = std::max(deepest, nesting(element));
    return deepest + 1;
  }
  return 0;
}

}  // namespace sl::fuzz

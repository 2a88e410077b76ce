// Small exported helpers: coercions of loosely typed property-list values,
// the process-wide high-resource-usage assertion, tasks run inside a process
// transaction, and the crash that an uncaught exception ends in.
//
// "Class" is the value's kind. A kind conforms to itself, and the boolean
// kind also conforms to the number kind (property-list booleans are
// numbers); no other kind derives from another. A null handle is of no kind.
#pragma once

#include <functional>

#include "Platform/ProcessServices.h"
#include "Platform/Value.h"

// Null for null; a string itself (the same node); anything else its text
// form, as "%@" prints it.
sl::String SLStringifyObject(const sl::Value& object);

// True when every element of `array` conforms to `cls`; true for an empty or
// null array. Stops at the first element that does not conform.
bool SLArrayContainsOnlyClass(const sl::Array& array, sl::ValueKind cls);

// A number's or boolean's truth value (non-zero is true); `defaultValue` for
// anything else, strings and null included.
bool SLBooleanValue(const sl::Value& object, bool defaultValue);

// `object` as an array of `cls`: null for null; an array itself when all its
// elements conform to `cls`, else null; an object that conforms to `cls` as
// a new one-element array; null for anything else. The array test comes
// first, so asking for ValueKind::Array treats an array as a list of arrays.
sl::Array SLArrayifyThing(const sl::Value& object, sl::ValueKind cls);

// Nesting assertion that heavy work is running: the first open assertion
// switches the CPU-usage monitor of the own process off, the clear that
// closes the last one restores its defaults. Any thread may call them; each
// clear must match an earlier assert.
void SLAssertHighResourceUsage();
void SLClearResourceAssertion();

// Opens a process transaction on the calling thread, then queues `task` on
// `queue`; the queued work runs `task` and ends the transaction. Returns at
// once; `task` is kept alive until it has run. An empty `task` just opens
// and ends the transaction.
void SLRunTransactionalTask(sl::TaskQueue& queue, std::function<void()> task);

// Writes the report of `exception` into the crash reporter's record and to
// standard error, then aborts the process. The report is
//   "** INTERNAL ERROR: Uncaught Exception **\n"
//   "Exception: " ["<" thread name "> "] [name ": "] [reason]
//   "\nStack:\n" frames joined by "\n"
// Concurrent calls are serialised by a lock that is never released: the
// first caller's report is the one written.
[[noreturn]] void SLCrashOnException(const sl::ExceptionReport& exception);

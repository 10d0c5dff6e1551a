// The process's temporary directory: where the storage engine puts its one temporary file.
//
//   std::string dir = kov::getTempDirectory();   // e.g. "/var/tmp" or "C:\\Users\\me\\Temp"
//
// getTempDirectory() answers for the whole process. The first call resolves the directory by a
// candidate search (TempDirectorySearch.h) and publishes it in the process-wide cache
// (TempDirectoryCache.h); every later call returns a copy of that same text, even after the
// environment or the file system has changed. Nothing checks the directory again, and nothing ever
// removes it, whether or not this module created it.
//
// Candidates, in order; the first that exists as a directory wins:
//   POSIX:   $KOV_TEMP, $TEMP, $TMP, $TMPDIR, "/var/tmp", "/tmp"
//   Windows: %KOV_TEMP%, %TEMP%, %TMP%, the local application-data folder + "/Temp", "c:/temp",
//            "c:/tmp"
// A candidate that is named but missing is skipped and never created. The last candidate is not
// tested: when the search reaches it, it is created (with missing parents) and used even when the
// creation fails, so the search never reports an error.
//
// The text returned is narrow (the bytes given on POSIX, the ANSI code page on Windows), in native
// form (the platform's separators, doubled separators collapsed) and without trailing separators.
//
// Environment values, and what becomes of them:
//   - unset or empty: skipped; the search goes on to the next candidate.
//   - only separators: on POSIX ("/", "///") treated as unset and skipped: the value names the
//     root of the file system, no place for a store's temporary file, and it would publish as an
//     empty text. On Windows the value is tested like any other, and only two such values are
//     chosen: a single "/" (its native form stays "/", the root of the current drive, which
//     exists) and exactly two backslashes (the network prefix, whose record is presumed to
//     exist). Either is published as an empty text, which the engine then reads as "use your
//     own default directory". Every other value made only of separators (one backslash, "//",
//     "/\/", three backslashes, ...) has an empty native form, which never exists: it is skipped.
//     (In this item, characters are as written in the variable, not C escapes.)
//   - very long (say 10 000 characters): tested like any other value; a path longer than the
//     platform accepts is reported missing by the file system and skipped.
//   - bytes that are not valid UTF-8 (or not valid in the ANSI code page): never rejected. On
//     POSIX nothing is converted: the bytes are the name; a value that names an existing
//     directory wins and comes back byte for byte; one that names nothing is skipped like any
//     missing directory. On Windows the directory object takes the value through the lossy
//     conversion from the ANSI code page, so an undefined byte is replaced in the name that is
//     tested, and what is published is that name converted back (lossily as well).
//   - a regular file, or a directory that does not exist: skipped, nothing is created.
//   - a bare drive ("Q:" or "Q:\\" on Windows) or a single ".": counts as an existing directory
//     without asking the file system, and is published as "Q:" or ".".
//
// Locks: two reader/writer locks, never held together. environmentMutex() is taken shared around
// each getenv call and the copy of its value; the cache's lock only while strings are copied or
// moved. No lock is held while a candidate is tested, created or located.
//
// Thread safety: every function here may be called from any thread. Two threads that both find the
// cache unpublished each resolve and publish; the later publish wins, and the two answers are equal
// unless the environment or the file system changed in between.
#ifndef KOVPAGER_TEMPDIR_TEMPDIRECTORY_H
#define KOVPAGER_TEMPDIR_TEMPDIRECTORY_H

#include <shared_mutex>
#include <string>

namespace kov {

// The process's temporary directory, resolved on the first call and cached for the life of the
// process. Returns a copy. Throws std::bad_alloc, std::range_error from the trailing-separator
// strip (stripCharacters) when the text has no UTF-8 form in the ANSI code page or the stripped
// text none back (Windows only), and std::system_error should the platform refuse a lock; a throw
// during the first resolution leaves the cache unpublished, and the next call resolves again.
std::string getTempDirectory();

// Resolves the temporary directory and publishes it in the process-wide cache, replacing whatever
// was published before. A null `explicitDirectory` runs the candidate search over the platform's
// list; the source published is the environment variable that supplied the winner, or empty.
// A non-null `explicitDirectory` is taken as the answer as it stands: nothing is tested, created or
// converted to native form, and the source published is empty. Either way trailing separators are
// stripped before publishing (stripCharacters, through UTF-8), so a text made only of separators
// publishes as an empty text. A std::range_error from the strip propagates and nothing is
// published.
void resolveTempDirectory(const char* explicitDirectory);

// The value of the environment variable `name`, read under environmentMutex() in shared mode;
// an empty string when the variable is unset (an empty value and an unset variable are alike).
std::string getEnvironmentVariable(const std::string& name);

// The module's lock over the process environment, created on the first call. This module takes it
// only in shared mode; code that changes the environment while other threads may read it should
// hold it exclusively.
std::shared_mutex& environmentMutex();

}  // namespace kov

#endif  // KOVPAGER_TEMPDIR_TEMPDIRECTORY_H

// Configuration store of the host.
//
// Keys and values come from a file of "key=value" lines named by the
// environment variable FSCANNER_CONFIG, read once, on the first call that
// needs them.  Blank lines and lines whose first non-blank character is '#'
// are ignored; blanks around keys and values are trimmed.  A line without '='
// or with an empty key is skipped and noted in getError().  A missing or
// unreadable file means no keys, and getError() says why.
//
// Tests and tools may replace the store in-process with setKey, clear and
// loadFile.  All operations are guarded by one process-wide mutex.
#ifndef FSCANNER_BASE_KELCFG_H
#define FSCANNER_BASE_KELCFG_H

#include "base/String.h"

class KelCfg {
public:
    // The value of key, or the empty text when the key is not set.
    static String getKey(const String& key);
    // The empty text when the last load was clean; otherwise one line that
    // names the file and the first problem found.
    static String getError();

    // Sets or replaces one key in the in-process store.
    static void setKey(const char* key, const char* value);
    // Removes one key; no effect when it is not set.
    static void removeKey(const char* key);
    // Forgets every key and the error, and marks the store as loaded, so that
    // FSCANNER_CONFIG is not read afterwards.
    static void clear();
    // Replaces the store by the contents of path.  Returns false when the file
    // cannot be read (the store is then empty and getError() says why).
    static bool loadFile(const char* path);
    // Forgets everything and returns to the initial state: the next lookup
    // reads FSCANNER_CONFIG again.
    static void reset();
};

#endif

// Shared pieces of the cache engine: the constants of the validity digests
// and the scanned-folder log.  The mark files themselves, their layout, reader
// and writer, are in cache_files.h.
//
// Scanned-folder log, at <common_trace_path>/traceKEL_scanned_dirs.log: plain
// text, emptied at each opening, a heading line and one line per directory.
#ifndef FSCANNER_FSCOMMON_CACHE_COMMON_H
#define FSCANNER_FSCOMMON_CACHE_COMMON_H

#include <cstddef>
#include <cstdint>
#include <cstdio>
#include <vector>

#include "fscanner/fs/fs_fileinfo.h"

namespace cachemarks {
const size_t MAX_KEY_LENGTH = 4095;        // a longer key is damage
const size_t PATH_BUFFER_SIZE = 4096;      // conversions stop at size - 1 bytes
const char PATHS_BREAK_MARKER[] = "**BREAK**";
const size_t PATHS_BREAK_FED = 9;          // bytes of the buffer fed after the marker
}  // namespace cachemarks

const char SCANNED_DIRS_LOG_HEADING[] = "LIST OF SCANNED DIRECTORIES DURING SOFTWARE SCAN:\n";
const int DEFAULT_NESTED_FOLDER_DEPTH = 4;

// How many levels below a root the folder log lists, from the key
// "trace_nested_folder_limit": empty, non-digits or 100000 and above give 4.
int getNestedFolderDepthForLogging();

// Opens <common_trace_path>/traceKEL_scanned_dirs.log with "w" and writes the
// heading.  Returns true on FAILURE (errno holds the cause, *file is null),
// false on success (*file owned by the caller, closed by closeFolderListLogfile).
bool openFolderListLogfile(FILE** file);
// Closes *file and sets it to null; null does nothing.  Returns fclose's result
// (0 for null).
int closeFolderListLogfile(FILE** file);
// Writes text and a line end; null file does nothing.
void logString(FILE* file, char const* text);
// Writes "<local date time> '<name>'" and a line end; null file does nothing.
void logFolderName(FILE* file, wchar_t const* name);
void logFolderName(FILE* file, char const* name);

// Same length and equal element by element, in order: a reordered list is a
// changed list.
bool samePathList(std::vector<PathInfo>& a, std::vector<PathInfo>& b);
bool sameFileSystemList(std::vector<FileSystemInfo>& a, std::vector<FileSystemInfo>& b);

#endif

// The absolute form of a path: "." and ".." settled, repeated "/" dropped, a
// relative path put behind the working directory.  PathHelper::realPath and
// the table store both answer through here.
//
// Internal to the library: hidden from its dynamic symbol table, as hosts
// have PathHelper::realPath.
#ifndef FSCANNER_FSCOMMON_RESOLVEPATH_H
#define FSCANNER_FSCOMMON_RESOLVEPATH_H

// With followLinks, symbolic links are resolved (at most 32).  Null when the
// narrow form is 4096 bytes or longer, on any failure of the system, or when
// the result would not fit in 4095 bytes.  The caller frees the result with
// kelm_free.
__attribute__((visibility("hidden")))
wchar_t* resolvePath(const wchar_t* path, bool followLinks);
// The same for a narrow path; the result is a narrow kelm_malloc block.
__attribute__((visibility("hidden")))
char* resolvePath(const char* path, bool followLinks);

#endif

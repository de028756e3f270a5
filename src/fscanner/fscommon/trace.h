// The trace prefix of a class member.  Members that trace name themselves as
// "<class>::<function> - " in front of the message; the class name comes from
// a member or local called className in the calling scope.  The macros keep
// that prefix, and the line, file and function of the call, in one place.
//
//   FS_TRACE(log, MAX, "opened '%ls'", name);
//     is log->traceMAX(__LINE__, __FILE__, __func__,
//                      "%s::%s - opened '%ls'", className, __func__, name);
//
// FS_TRACE_AS takes the whole format, for the few messages whose prefix
// differs ("IMPORTANT: %s::%s - ", "%s::%s() - "); className and __func__
// still fill its first two conversions.  LEVEL is MIN, MID or MAX.
//
// FS_TRACE_FOR and FS_TRACE_AS_FOR name the class and the function
// themselves, for code that traces on behalf of a member it serves (the
// cache walk's receiver traces as "<class>::scan"); the function also stands
// as the function of the trace line.
#ifndef FSCANNER_FSCOMMON_TRACE_H
#define FSCANNER_FSCOMMON_TRACE_H

#include "base/QvLogWrapper.h"

#define FS_TRACE_AS_FOR(log, LEVEL, cls, function, format, ...) \
    (log)->trace##LEVEL(__LINE__, __FILE__, function, format, cls, function, ##__VA_ARGS__)

#define FS_TRACE_FOR(log, LEVEL, cls, function, format, ...) \
    FS_TRACE_AS_FOR(log, LEVEL, cls, function, "%s::%s - " format, ##__VA_ARGS__)

#define FS_TRACE_AS(log, LEVEL, format, ...) \
    FS_TRACE_AS_FOR(log, LEVEL, className, __func__, format, ##__VA_ARGS__)

#define FS_TRACE(log, LEVEL, format, ...) FS_TRACE_AS(log, LEVEL, "%s::%s - " format, ##__VA_ARGS__)

#endif

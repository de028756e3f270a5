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
#ifndef FSCANNER_FSCOMMON_TRACE_H
#define FSCANNER_FSCOMMON_TRACE_H

#include "base/QvLogWrapper.h"

#define FS_TRACE_AS(log, LEVEL, format, ...) \
    (log)->trace##LEVEL(__LINE__, __FILE__, __func__, format, className, __func__, ##__VA_ARGS__)

#define FS_TRACE(log, LEVEL, format, ...) FS_TRACE_AS(log, LEVEL, "%s::%s - " format, ##__VA_ARGS__)

#endif

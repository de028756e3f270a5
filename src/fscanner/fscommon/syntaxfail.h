// How a SyntaxAnalyzer member gives up on an expression: it sets the
// analyzer's failure flag, keeps the message as the error text a caller can
// show, and traces the same message at the most detailed level.  The
// expression yields false, so an evaluation step can `return FS_SA_FAIL(...)`
// while a parse step, which goes on to unwind, uses it as a statement.
//
// For syntaxanalyzer.cpp and expvalue.cpp only: it reads the members error,
// trace and noteError of the analyzer it runs in.
#ifndef FSCANNER_FSCOMMON_SYNTAXFAIL_H
#define FSCANNER_FSCOMMON_SYNTAXFAIL_H

#include "base/QvLogWrapper.h"

#define FS_SA_FAIL(...)                                                                 \
    (error = true, noteError(QvLogWrapper::format(__VA_ARGS__)),                         \
     trace != nullptr ? trace->traceMAX(__LINE__, __FILE__, __FUNCTION__, __VA_ARGS__)   \
                      : (void)0,                                                         \
     false)

#endif

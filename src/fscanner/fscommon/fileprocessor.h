// The two commands that the direct walk adds to the query language (see
// FileProcessor in fsbuild.h, which registers them):
//   path(number, text) -> text    the full path of the current file
//   type(text, text)   -> number  1 when the file named first is of a kind
//                                 the second names, as `file` words it
// Both are owned by their FileProcessor; the command table only points at
// them.  One thread at a time.
#ifndef FSCANNER_FSCOMMON_FILEPROCESSOR_H
#define FSCANNER_FSCOMMON_FILEPROCESSOR_H

#include "fscanner/fs/fs_fileinfo.h"
#include "fscanner/fscommon/expvalue.h"
#include "fscanner/fscommon/filetypehelper.h"

class QvLogWrapper;

// path(number, text): a string result, the path of the file last handed to
// setFsFileInfo joined with its name; empty text while no file is set.  The
// arguments are not read.  Always succeeds (0).
class fpPathCommand : public BinaryCmd {
public:
    fpPathCommand() : info(nullptr) {}
    int execute(ExpValue const& first, ExpValue const& second, ExpValue& result) override;
    // Not owned; must stay alive while the expression is checked.  Null
    // forgets the file.
    void setFsFileInfo(FsFileInfo const* file) { info = file; }
    FsFileInfo const* getFsFileInfo() const { return info; }

private:
    FsFileInfo const* info;
};

// type(text, text): a numeric result, 1 when FileTypeChecker finds one of the
// words of the second argument in the description of the file named by the
// first, else 0.  A file that can't be classified (refused path, missing
// `file` command) gives 0.  An argument without text fails the command (1),
// which fails the expression.
class fpTypeCommand : public BinaryCmd {
public:
    fpTypeCommand();
    int execute(ExpValue const& first, ExpValue const& second, ExpValue& result) override;

private:
    FileTypeChecker checker;
    QvLogWrapper* log;
};

#endif

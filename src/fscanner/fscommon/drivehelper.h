// The drive list: one DriveInfo per mount point, taken from the mount table
// and the automounter maps, and its pruning by the query's file systems and
// exclude paths.
//
// A drive's name is its mount directory with ":" behind it ("/usr:", "/:").
// Everything runs on the query's thread; every loop calls
// CpuThreshold::doIteration.
#ifndef FSCANNER_FSCOMMON_DRIVEHELPER_H
#define FSCANNER_FSCOMMON_DRIVEHELPER_H

#include <vector>

#include "fscanner/fs/fs_fileinfo.h"

class QvLogWrapper;

// Wakes the automounter: for each dummy mount (other than "/net" and
// "/smb", which would reach every host) every key below it is looked up.
void accessToAllMountPaths();

// True when some entry's name equals name by wcsvccmp(entryName, name,
// caseSensitive).
bool checkFileSystems(const wchar_t* name, std::vector<FileSystemInfo>& list, bool caseSensitive);

class DriveHelper {
public:
    DriveHelper();

    void setNoAutoFS(unsigned int value);
    // The kind given to dummy automounter rows; dtAutoFS means none assumed.
    void setAssumeAutoFSDriveType(DriveType value);

    // Appends the drives of the mount table and of the remote automounter
    // mount points whose kind meets mask.  The list is neither sorted nor
    // de-duplicated.  Always returns 1.
    int buildDriveList(std::vector<DriveInfo>& out, unsigned int mask);

    // Appends to out a copy of each drive of in that the file system lists
    // allow and no exclude path covers.  Drives cut by an exclude path get
    // excludedDrive set in in.  File system names are compared without
    // regard to case; caseSensitive applies to the exclude paths.
    void fileSystemDriveListPruning(std::vector<DriveInfo>& in, std::vector<DriveInfo>& out,
                                    std::vector<FileSystemInfo>& includedFileSystems,
                                    std::vector<FileSystemInfo>& excludedFileSystems,
                                    bool caseSensitive, std::vector<PathInfo>& excludedPaths);

    // Index of the first drive whose name begins with name (which must end
    // in ":"), or -1.
    int checkDrive(const std::vector<DriveInfo>& list, const wchar_t* name, bool caseSensitive);

    // Kind of the mount on mountDir (no ":"): the last matching non-dummy
    // row of the mount table decides; dtUnknown when none matches.
    DriveType getDriverType(wchar_t* mountDir);

    // Test seam: the automounter master file read by buildDriveList,
    // "/etc/auto.master" by default.  Null or empty restores the default.
    // Process-wide, unguarded.
    static void setAutomounterMasterPath(const char* path);
    static const char* getAutomounterMasterPath();

    static const char* const DEFAULT_AUTOMOUNTER_MASTER_PATH;

private:
    QvLogWrapper* log;
    unsigned int noAutoFS;
    DriveType assumeAutoFSDriveType;
};

#endif

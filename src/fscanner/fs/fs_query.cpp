#include "fscanner/fs/fs_query.h"

#include <cwchar>
#include <iostream>

#include "base/QvLogWrapper.h"
#include "base/kelmem.h"
#include "fscanner/fscommon/mountlist.h"
#include "fscanner/fscommon/stringhelper.h"
#include "fscanner/fscommon/utils.h"
#include "fscanner/fscommon/wildcard.h"

FsQueryData::FsQueryData()
    : query(nullptr),
      caseSensitive(2),
      assumeAutoFSDriveType(dtAutoFS),
      cpuThreshold(nullptr),
      firstTimeOnly(false),
      fileSystemScan(false) {}

FsQuery::FsQuery() : data(new FsQueryData()), log(getQvLogFs()) {}

int FsQuery::addIncludePath(const wchar_t* path, bool recursive) {
    if (path == nullptr) return 0;
    log->traceMAX(__LINE__, __FILE__, __FUNCTION__,
                  "%s - adding include path to query: '%ls', recursive: %d\n",
                  "FsQuery::addIncludePath", path, recursive ? 1 : 0);
    data->includedPathList.push_back(PathInfo(path, recursive));
    return 1;
}

int FsQuery::addExcludePath(const wchar_t* path, bool recursive) {
    if (path == nullptr) return 0;
    data->excludedPathList.push_back(PathInfo(path, recursive));
    return 1;
}

int FsQuery::addIncludeFileSystem(const wchar_t* fileSystem) {
    if (fileSystem == nullptr) return 0;
    data->includedFileSystemList.push_back(FileSystemInfo(fileSystem));
    return 1;
}

int FsQuery::addExcludeFileSystem(const wchar_t* fileSystem) {
    if (fileSystem == nullptr) return 0;
    data->excludedFileSystemList.push_back(FileSystemInfo(fileSystem));
    return 1;
}

int FsQuery::addRemoteFileSystem(const char* fileSystem) {
    // A null name can't become a std::string; it is refused rather than read.
    if (fileSystem == nullptr) return 0;
    MountTableManager::remoteFileSystems.push_back(std::string(fileSystem));
    return 1;
}

int FsQuery::setQuery(const wchar_t* query) {
    if (query == nullptr) return 0;
    wchar_t* copy = wideDuplicate(query);
    if (copy == nullptr) return 0;
    kelm_free(data->query);
    data->query = copy;
    return 1;
}

void FsQuery::setCaseSensitive(unsigned int mode) {
    if (mode < 3) data->caseSensitive = mode;
}

std::vector<PathInfo>& FsQuery::getIncludedPaths() const { return data->includedPathList; }
std::vector<PathInfo>& FsQuery::getExcludedPaths() const { return data->excludedPathList; }
std::vector<FileSystemInfo>& FsQuery::getIncludedFileSystems() const {
    return data->includedFileSystemList;
}
std::vector<FileSystemInfo>& FsQuery::getExcludedFileSystems() const {
    return data->excludedFileSystemList;
}

const wchar_t* FsQuery::getQuery() const { return data->query; }

bool FsQuery::getCaseSensitive() const { return data->caseSensitive != 1; }

int FsQuery::clearIncludePaths() {
    data->includedPathList.clear();
    return 1;
}

int FsQuery::clearExcludePaths() {
    data->excludedPathList.clear();
    return 1;
}

int FsQuery::clearIncludeFileSystems() {
    data->includedFileSystemList.clear();
    return 1;
}

int FsQuery::clearExcludeFileSystems() {
    data->excludedFileSystemList.clear();
    return 1;
}

int FsQuery::clearRemoteFileSystems() {
    MountTableManager::remoteFileSystems.clear();
    return 1;
}

void FsQuery::setAssumeAutoFSDriveType(DriveType type) { data->assumeAutoFSDriveType = type; }

DriveType FsQuery::getAssumeAutoFSDriveType() const { return data->assumeAutoFSDriveType; }

void FsQuery::setCpuThreshold(const char* threshold) {
    // The previous copy is deliberately not released: setting the threshold
    // twice loses the first copy.
    data->cpuThreshold = i_strdup(threshold);
}

const char* FsQuery::getCpuThreshold() const { return data->cpuThreshold; }

void FsQuery::setFirstTimeOnly(bool value) { data->firstTimeOnly = value; }
bool FsQuery::getFirstTimeOnly() const { return data->firstTimeOnly; }
void FsQuery::setFileSystemScan(bool value) { data->fileSystemScan = value; }
bool FsQuery::isFileSystemScan() const { return data->fileSystemScan; }

void FsQuery::addFileOrMaskForCaching(const wchar_t* nameOrMask) {
    addNameOrNameMaskToRightContainer<wchar_t, std::wstring>(nameOrMask, data->masksForCaching,
                                                             data->filesForCaching);
}

void FsQuery::addFileOrMaskForCaching(std::wstring nameOrMask) {
    addNameOrNameMaskToRightContainer<wchar_t, std::wstring>(nameOrMask, data->masksForCaching,
                                                             data->filesForCaching);
}

bool FsQuery::fileShouldBeCached(const wchar_t* name) const {
    if (name == nullptr) return false;
    return nameFoundOrMatchedAMask<wchar_t, std::wstring>(std::wstring(name), data->masksForCaching,
                                                          data->filesForCaching);
}

void FsQuery::addFileOrMaskForQuery(const wchar_t* nameOrMask) {
    addNameOrNameMaskToRightContainer<wchar_t, std::wstring>(nameOrMask, data->masksForQuery,
                                                             data->filesForQuery);
}

void FsQuery::addFileOrMaskForQuery(std::wstring nameOrMask) {
    addNameOrNameMaskToRightContainer<wchar_t, std::wstring>(nameOrMask, data->masksForQuery,
                                                             data->filesForQuery);
}

std::vector<std::wstring> FsQuery::getMasksForQuery() const { return data->masksForQuery; }

std::set<std::wstring> FsQuery::getFilesForQuery() const { return data->filesForQuery; }

bool FsQuery::fileMatchesQuery(const wchar_t* name) const {
    if (name == nullptr) return false;
    return nameFoundOrMatchedAMask<wchar_t, std::wstring>(std::wstring(name), data->masksForQuery,
                                                          data->filesForQuery);
}

unsigned int FsQuery::getFileOrMaskForCachingSetSize() const {
    return static_cast<unsigned int>(data->filesForCaching.size() + data->masksForCaching.size());
}

std::set<std::wstring>& FsQuery::getFilesForCaching() { return data->filesForCaching; }

std::vector<std::wstring>& FsQuery::getMasksForCaching() { return data->masksForCaching; }

void FsQuery::dump() {
    std::wostream& out = std::wcout;
    out << L"query=" << (data->query != nullptr ? data->query : L"") << std::endl;
    out << L"caseSensitive=" << data->caseSensitive << std::endl;
    out << L"assumeAutoFSDriveType=" << static_cast<int>(data->assumeAutoFSDriveType) << std::endl;
    out << std::endl;
    out << L"-- includedPathList ---------------------------" << std::endl;
    for (const PathInfo& path : data->includedPathList) {
        out << L" path=" << (path.getPathName() != nullptr ? path.getPathName() : L"")
            << L"; recursive=" << (path.getRecursive() ? 1 : 0) << std::endl;
    }
    out << std::endl;
    out << L"-- excludedPathList ---------------------------" << std::endl;
    for (const PathInfo& path : data->excludedPathList) {
        out << L" path=" << (path.getPathName() != nullptr ? path.getPathName() : L"")
            << L"; recursive=" << (path.getRecursive() ? 1 : 0) << std::endl;
    }
    out << std::endl;
    out << L"-- includedFileSystemList ---------------------------" << std::endl;
    for (const FileSystemInfo& fs : data->includedFileSystemList) {
        out << L" name=" << (fs.getFileSystemName() != nullptr ? fs.getFileSystemName() : L"")
            << std::endl;
    }
    out << std::endl;
    out << L"-- excludedFileSystemList ---------------------------" << std::endl;
    for (const FileSystemInfo& fs : data->excludedFileSystemList) {
        out << L" name=" << (fs.getFileSystemName() != nullptr ? fs.getFileSystemName() : L"")
            << std::endl;
    }
}

FsQuery::~FsQuery() {
    kelm_free(data->query);
    kelm_free(data->cpuThreshold);
    delete data;
}

template <typename CharType, typename StringType>
void FsQuery::addNameOrNameMaskToRightContainer(StringType nameOrMask,
                                                std::vector<StringType>& masks,
                                                std::set<StringType>& names) const {
    if (nameOrMask.empty()) {
        log->traceMAX(__LINE__, __FILE__, __FUNCTION__, "%s - nameOrNameMask is empty, skipping it.\n",
                      "FsQuery::addNameOrNameMaskToRightContainer");
        return;
    }
    // The mode in force now decides; a later change does not re-fold what is
    // stored.
    if (!getCaseSensitive()) utils::stringToLower(nameOrMask);
    const CharType star = CharType('*');
    const CharType question = CharType('?');
    if (nameOrMask.find(star) != StringType::npos || nameOrMask.find(question) != StringType::npos) {
        masks.push_back(nameOrMask);
    } else {
        names.insert(nameOrMask);
    }
}

template <typename CharType, typename StringType>
void FsQuery::addNameOrNameMaskToRightContainer(const CharType* nameOrMask,
                                                std::vector<StringType>& masks,
                                                std::set<StringType>& names) const {
    if (nameOrMask == nullptr) {
        log->traceMAX(__LINE__, __FILE__, __FUNCTION__, "%s - nameOrNameMask is NULL, skipping it.\n",
                      "FsQuery::addNameOrNameMaskToRightContainer");
        return;
    }
    addNameOrNameMaskToRightContainer<CharType, StringType>(StringType(nameOrMask), masks, names);
}

template <typename CharType, typename StringType>
bool FsQuery::nameFoundOrMatchedAMask(StringType name, const std::vector<StringType>& masks,
                                      const std::set<StringType>& names) const {
    if (name.empty()) {
        log->traceMAX(__LINE__, __FILE__, __FUNCTION__,
                      "%s - name to find is empty, nothing to find - returning false.\n",
                      "FsQuery::nameFoundOrMatchedAMask");
        return false;
    }
    if (!getCaseSensitive()) utils::stringToLower(name);
    if (names.find(name) != names.end()) return true;
    for (size_t i = 0; i < masks.size(); ++i) {
        if (utils::matchWildcard<CharType>(masks[i].c_str(), name.c_str())) return true;
    }
    return false;
}

template void FsQuery::addNameOrNameMaskToRightContainer<char, std::string>(
    std::string, std::vector<std::string>&, std::set<std::string>&) const;
template void FsQuery::addNameOrNameMaskToRightContainer<char, std::string>(
    const char*, std::vector<std::string>&, std::set<std::string>&) const;
template bool FsQuery::nameFoundOrMatchedAMask<char, std::string>(
    std::string, const std::vector<std::string>&, const std::set<std::string>&) const;
template void FsQuery::addNameOrNameMaskToRightContainer<wchar_t, std::wstring>(
    std::wstring, std::vector<std::wstring>&, std::set<std::wstring>&) const;
template void FsQuery::addNameOrNameMaskToRightContainer<wchar_t, std::wstring>(
    const wchar_t*, std::vector<std::wstring>&, std::set<std::wstring>&) const;
template bool FsQuery::nameFoundOrMatchedAMask<wchar_t, std::wstring>(
    std::wstring, const std::vector<std::wstring>&, const std::set<std::wstring>&) const;

#include "fscanner/fscommon/cache_common.h"

#include <cerrno>
#include <cstdlib>
#include <cwctype>
#include <string>

#include "base/KelCfg.h"
#include "base/String.h"
#include "fscanner/fscommon/cache_files.h"
#include "fscanner/fscommon/env.h"
#include "fscanner/fscommon/stringhelper.h"

int getNestedFolderDepthForLogging()
{
    String value = KelCfg::getKey(String("trace_nested_folder_limit"));
    const char* text = value;
    if (text == nullptr || *text == '\0')
        return DEFAULT_NESTED_FOLDER_DEPTH;
    for (const char* p = text; *p != '\0'; ++p) {
        if (!iswdigit(static_cast<wint_t>(static_cast<unsigned char>(*p))))
            return DEFAULT_NESTED_FOLDER_DEPTH;
    }
    errno = 0;
    unsigned long number = strtoul(text, nullptr, 10);
    if (errno != 0 || number >= 100000UL)
        return DEFAULT_NESTED_FOLDER_DEPTH;
    return static_cast<int>(number);
}

bool openFolderListLogfile(FILE** file)
{
    if (file == nullptr) {
        errno = EINVAL;
        return true;
    }
    String dir = KelCfg::getKey(String("common_trace_path"));
    std::string path = cachefiles::folderLogPath(dir);
    *file = fscanner::Env::Current()->openStream(path.c_str(), "w");
    if (*file == nullptr)
        return true;
    fputs(SCANNED_DIRS_LOG_HEADING, *file);
    return false;
}

int closeFolderListLogfile(FILE** file)
{
    if (file == nullptr || *file == nullptr)
        return 0;
    int rc = fscanner::Env::Current()->closeStream(*file);
    *file = nullptr;
    return rc;
}

void logString(FILE* file, char const* text)
{
    if (file == nullptr || text == nullptr)
        return;
    fprintf(file, "%s\n", text);
}

void logFolderName(FILE* file, wchar_t const* name)
{
    if (file == nullptr || name == nullptr)
        return;
    std::string when = utils::getLocalDatetimeXML();
    fprintf(file, "%s '%ls'\n", when.c_str(), name);
}

void logFolderName(FILE* file, char const* name)
{
    if (file == nullptr || name == nullptr)
        return;
    std::string when = utils::getLocalDatetimeXML();
    fprintf(file, "%s '%s'\n", when.c_str(), name);
}

namespace {

// Same length and equal entries in the same order.
template <typename Entry>
bool sameList(std::vector<Entry>& a, std::vector<Entry>& b)
{
    if (a.size() != b.size())
        return false;
    for (size_t i = 0; i < a.size(); ++i) {
        if (!(a[i] == b[i]))
            return false;
    }
    return true;
}

}  // namespace

bool samePathList(std::vector<PathInfo>& a, std::vector<PathInfo>& b)
{
    return sameList(a, b);
}

bool sameFileSystemList(std::vector<FileSystemInfo>& a, std::vector<FileSystemInfo>& b)
{
    return sameList(a, b);
}

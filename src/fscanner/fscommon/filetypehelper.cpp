// The file type check.  See filetypehelper.h for the contract.
#include "fscanner/fscommon/filetypehelper.h"

#include <dirent.h>
#include <sys/stat.h>

#include <cstdint>
#include <cstdlib>
#include <cstring>
#include <string>

#include "base/QvLogWrapper.h"
#include "base/kelmem.h"
#include "fscanner/fscommon/env.h"
#include "fscanner/fscommon/stringhelper.h"
#include "fscanner/fscommon/utils.h"

const char FileTypeChecker::FILE_COMMAND[] = "LANG=C; export LANG; file \"%s\" 2>/dev/null";
const char FileTypeChecker::DIRECTORY_COMMAND[] =
    "cd \"%s\";LANG=C; export LANG; ls | xargs file 2> /dev/null";
const char FileTypeChecker::LIST_COMMAND[] = "LANG=C; export LANG; file -f %s 2>/dev/null";

namespace {

// Ids run 1..65536; -1 marks an empty Element.
const int EMPTY_ID = -1;
const int BATCH_MODULUS = 65536;

// Narrow form of a wide text in the current locale; false when a character
// has no narrow form.
bool toNarrow(wchar_t const* text, std::string& out) {
    char* narrow = utils::myWcsToMbsString(text);
    if (narrow == nullptr) return false;
    out = narrow;
    delete[] narrow;
    // A failed conversion comes back empty; only an empty text may.
    return !out.empty() || text[0] == L'\0';
}

// The wide form of text in out, of size characters, always ended; an
// unconvertible text leaves out empty and gives false.
bool toWide(char const* text, wchar_t* out, size_t size) {
    size_t length = mbstowcs(out, text, size - 1);
    if (length == static_cast<size_t>(-1)) {
        out[0] = L'\0';
        return false;
    }
    out[length] = L'\0';
    return true;
}

// The first character of text that would end or expand inside a double-quoted
// shell word, or 0 when there is none.  Everything else stands literally
// between double quotes.
char quoteBreaker(char const* text) {
    for (char const* p = text; *p != '\0'; ++p) {
        if (*p == '"' || *p == '`' || *p == '$' || *p == '\\') return *p;
    }
    return 0;
}

// True when text may stand double-quoted as the file command's argument:
// nothing in it would end the quotes, and no leading '-' would make it an
// option.  Otherwise the refusal is traced, as the checker's member function
// naming what the text is ("path", "directory"), and the answer is false.
bool quotableArgument(QvLogWrapper* log, char const* function, char const* what,
                      std::string const& text) {
    char bad = quoteBreaker(text.c_str());
    if (bad != 0) {
        log->traceMAX(__LINE__, __FILE__, function,
                      "FileTypeChecker::%s - %s '%s' holds '%c', which would break the quoted "
                      "command; not run\n",
                      function, what, text.c_str(), bad);
        return false;
    }
    if (text[0] == '-') {
        log->traceMAX(__LINE__, __FILE__, function,
                      "FileTypeChecker::%s - %s '%s' begins with '-' and would be read as an "
                      "option; not run\n",
                      function, what, text.c_str());
        return false;
    }
    return true;
}

// The first character of text that the shell would read as more than a
// literal in a bare word, or 0.  Blanks are let through: they only split the
// word, which is what the unquoted list command does to such a name.
char bareWordBreaker(char const* text) {
    static const char special[] = "\"'`$\\;&|<>()*?[]#~{}!";
    for (char const* p = text; *p != '\0'; ++p) {
        unsigned char c = static_cast<unsigned char>(*p);
        if (c < 0x20 || c == 0x7f || std::strchr(special, *p) != nullptr) return *p;
    }
    return 0;
}

int& batchNumber() {
    static int batch = 1;
    return batch;
}

}  // namespace

// ---- Element ---------------------------------------------------------------

Element::Element() : id(EMPTY_ID), fileTypeInfo(nullptr) {}

Element::Element(int id, wchar_t const* text) : id(id), fileTypeInfo(wideDuplicate(text)) {}

Element::Element(Element const& other)
    : id(other.id), fileTypeInfo(wideDuplicate(other.fileTypeInfo)) {}

Element& Element::operator=(Element const& other) {
    if (this != &other) {
        wchar_t* copy = wideDuplicate(other.fileTypeInfo);
        kelm_free(fileTypeInfo);
        fileTypeInfo = copy;
        id = other.id;
    }
    return *this;
}

Element::~Element() { kelm_free(fileTypeInfo); }

int Element::getID() const { return id; }

wchar_t* Element::getFileTypeInfo() const { return fileTypeInfo; }

void Element::setData(int newId, wchar_t* text, bool copy) {
    wchar_t* owned = copy ? wideDuplicate(text) : text;
    if (owned != fileTypeInfo) kelm_free(fileTypeInfo);
    fileTypeInfo = owned;
    id = newId;
}

wchar_t* Element::releaseFileTypeInfo() {
    wchar_t* text = fileTypeInfo;
    fileTypeInfo = nullptr;
    return text;
}

// ---- FileTypeCache ---------------------------------------------------------

FileTypeCache::FileTypeCache(unsigned int capacity)
    : capacity(capacity < MIN_CAPACITY ? MIN_CAPACITY : capacity), lastBatchId(EMPTY_ID) {}

void FileTypeCache::insert(Element const& element) {
    int keep = element.getID();
    // The oldest entry names the batch to drop, all of it at once.  Once the
    // oldest entry belongs to the new element's batch, nothing more goes:
    // that batch stays whole, beyond capacity if it must.  Looking only at the
    // oldest end keeps an insert cheap while one huge directory is read.
    while (elements.size() >= capacity && !elements.empty() && elements.front().getID() != keep) {
        int victim = elements.front().getID();
        for (std::list<Element>::iterator it = elements.begin(); it != elements.end();) {
            if (it->getID() == victim) {
                it = elements.erase(it);
            } else {
                ++it;
            }
        }
    }
    elements.push_back(element);
    lastBatchId = keep;
}

Element FileTypeCache::find(wchar_t const* key, bool /*flag*/) {
    if (key == nullptr) return Element();
    size_t length = wcslen(key);
    for (std::list<Element>::iterator it = elements.begin(); it != elements.end(); ++it) {
        wchar_t const* text = it->getFileTypeInfo();
        if (text != nullptr && wcsncmp(text, key, length) == 0) {
            Element hit(*it);
            elements.erase(it);
            return hit;
        }
    }
    return Element();
}

void FileTypeCache::print() {
    QvLogWrapper* log = getQvLogFs();
    for (std::list<Element>::const_iterator it = elements.begin(); it != elements.end(); ++it) {
        wchar_t const* text = it->getFileTypeInfo();
        log->traceMAX(__LINE__, __FILE__, "FileTypeCache::print", "[%d] - %S\n", it->getID(),
                      text != nullptr ? text : L"");
    }
}

unsigned int FileTypeCache::getCapacity() const { return capacity; }

int FileTypeCache::getLastBatchId() const { return lastBatchId; }

size_t FileTypeCache::size() const { return elements.size(); }

void FileTypeCache::clear() {
    elements.clear();
    lastBatchId = EMPTY_ID;
}

// ---- FileTypeChecker -------------------------------------------------------

FileTypeChecker::FileTypeChecker()
    : lineBuffer(static_cast<char*>(kelm_malloc(BUFFER_SIZE))),
      tab(L'\t'),
      lineFeed(L'\n'),
      log(getQvLogFs()) {
    buffer[0] = '\0';
    wbuffer[0] = L'\0';
    if (lineBuffer != nullptr) lineBuffer[0] = '\0';
    snprintf(listFileName, sizeof(listFileName), "./kel_cmd_file_%lx",
             static_cast<unsigned long>(reinterpret_cast<uintptr_t>(this)));
}

FileTypeChecker::~FileTypeChecker() { kelm_free(lineBuffer); }

FileTypeCache& FileTypeChecker::batchCache() {
    static FileTypeCache cache;
    return cache;
}

FileTypeCache& FileTypeChecker::listCache() {
    static FileTypeCache cache;
    return cache;
}

int FileTypeChecker::currentBatch() { return batchNumber(); }

char const* FileTypeChecker::getListFileName() const { return listFileName; }

char* FileTypeChecker::makeCommand(char const* format, char const* argument, char const* function) {
    size_t size = strlen(format) + strlen(argument) + 1;
    char* cmd = static_cast<char*>(kelm_malloc(size));
    if (cmd == nullptr) {
        log->traceMAX(__LINE__, __FILE__, function, "FileTypeChecker::check - 'cmd' malloc failed!\n");
        return nullptr;
    }
    snprintf(cmd, size, format, argument);
    return cmd;
}

FILE* FileTypeChecker::openCommand(char const* cmd, char const* function) {
    log->traceMAX(__LINE__, __FILE__, function, "FileTypeChecker::%s - running '%s'\n", function, cmd);
    FILE* pipe = fscanner::Env::Current()->openPipe(cmd, "r");
    if (pipe == nullptr) {
        log->traceMAX(__LINE__, __FILE__, function, "FileTypeChecker::check - cannot open '%s' cmd file!\n",
                      cmd);
    }
    return pipe;
}

bool FileTypeChecker::getFileType(wchar_t const* path, wchar_t** out) {
    static char const* const function = "getFileType";
    if (lineBuffer == nullptr || path == nullptr || out == nullptr || path[0] == L'\0') return false;

    std::string narrow;
    if (!toNarrow(path, narrow)) {
        log->traceMAX(__LINE__, __FILE__, function,
                      "FileTypeChecker::getFileType - '%S' has no narrow form\n", path);
        return false;
    }
    if (!quotableArgument(log, function, "path", narrow)) return false;

    char* cmd = makeCommand(FILE_COMMAND, narrow.c_str(), function);
    if (cmd == nullptr) return false;
    FILE* pipe = openCommand(cmd, function);
    kelm_free(cmd);
    if (pipe == nullptr) return false;

    // Only a line that begins with the path counts; one that holds the path
    // further on (a message of `file` about it, say) is passed over.
    bool found = false;
    while (fgets(lineBuffer, BUFFER_SIZE, pipe) != nullptr) {
        if (strncmp(lineBuffer, narrow.c_str(), narrow.size()) == 0) {
            found = true;
            break;
        }
    }
    fscanner::Env::Current()->closePipe(pipe);
    if (!found) return false;

    if (!toWide(lineBuffer, wbuffer, BUFFER_SIZE)) {
        log->traceMAX(__LINE__, __FILE__, function,
                      "FileTypeChecker::getFileType - output line for '%S' has no wide form\n", path);
        return false;
    }
    wchar_t* line = wideDuplicate(wbuffer);
    if (line == nullptr) return false;
    *out = line;
    return true;
}

bool FileTypeChecker::getFileTypeEx(wchar_t const* path, wchar_t** out) {
    return lookUpInDirectory(path, out, false);
}

bool FileTypeChecker::getFileTypeEx_2(wchar_t const* path, wchar_t** out) {
    return lookUpInDirectory(path, out, true);
}

// Reads every output line of cmd into the narrow buffer behind prefix, so that
// each begins with a full path.  The line that begins with key becomes the
// answer, of this batch; every other line goes into cache.  Moves the batch
// number on after the run.  False only when the command can't be started.
bool FileTypeChecker::runBatch(char const* cmd, char const* prefix, wchar_t const* key,
                               FileTypeCache& cache, Element& answer) {
    char const* function = "runBatch";
    FILE* pipe = openCommand(cmd, function);
    if (pipe == nullptr) return false;

    int batch = batchNumber();
    size_t prefixLength = strlen(prefix);
    size_t keyLength = wcslen(key);
    memcpy(buffer, prefix, prefixLength);
    buffer[prefixLength] = '\0';
    while (fgets(buffer + prefixLength, static_cast<int>(BUFFER_SIZE - prefixLength), pipe) != nullptr) {
        // An unconvertible line is kept, empty: it answers no key.
        toWide(buffer, wbuffer, BUFFER_SIZE);
        if (wcsncmp(wbuffer, key, keyLength) == 0) {
            answer.setData(batch, wbuffer, true);
        } else {
            cache.insert(Element(batch, wbuffer));
        }
    }
    fscanner::Env::Current()->closePipe(pipe);
    batchNumber() = batch % BATCH_MODULUS + 1;
    return true;
}

bool FileTypeChecker::lookUpInDirectory(wchar_t const* path, wchar_t** out, bool listFileMode) {
    char const* function = listFileMode ? "getFileTypeEx_2" : "getFileTypeEx";
    if (path == nullptr || out == nullptr) return false;
    if (wcslen(path) > MAX_PATH_CHARS) {
        log->traceMAX(__LINE__, __FILE__, function, "FileTypeChecker::%s - path '%S' too long\n", function,
                      path);
        return false;
    }

    // The ":" behind the path makes the key match the name field of a line
    // only, never a longer name that begins with this one.
    std::wstring key(path);
    key += L':';
    FileTypeCache& cache = listFileMode ? listCache() : batchCache();
    Element hit = cache.find(key.c_str(), true);
    if (hit.getID() != EMPTY_ID) {
        wchar_t* line = hit.releaseFileTypeInfo();
        if (line == nullptr) return false;
        *out = line;
        return true;
    }

    std::string narrow;
    if (!toNarrow(path, narrow)) {
        log->traceMAX(__LINE__, __FILE__, function, "FileTypeChecker::%s - '%S' has no narrow form\n",
                      function, path);
        return false;
    }
    std::string::size_type slash = narrow.rfind('/');
    if (slash == std::string::npos) return false;
    std::string dir = narrow.substr(0, slash);
    if (dir.empty()) dir = "/";

    Element answer;
    if (!listFileMode) {
        if (!quotableArgument(log, function, "directory", dir)) return false;
        std::string prefix = dir == "/" ? dir : dir + "/";
        if (prefix.size() + 2 > BUFFER_SIZE) {
            log->traceMAX(__LINE__, __FILE__, function,
                          "FileTypeChecker::getFileTypeEx - directory '%s' too long for a line\n",
                          dir.c_str());
            return false;
        }
        // `cd` failing would let `ls` list the working directory under this
        // directory's name, and a listed name that begins with "-" would reach
        // `file` as an option.  Either way no answer could be trusted.
        fscanner::Env* env = fscanner::Env::Current();
        DIR* handle = env->openDirectory(dir.c_str());
        if (handle == nullptr) {
            log->traceMAX(__LINE__, __FILE__, function,
                          "FileTypeChecker::getFileTypeEx - cannot open directory '%s'; not run\n",
                          dir.c_str());
            return false;
        }
        bool optionName = false;
        for (struct dirent* entry = env->readDirectory(handle); entry != nullptr;
             entry = env->readDirectory(handle)) {
            if (entry->d_name[0] == '-') {
                log->traceMAX(__LINE__, __FILE__, function,
                              "FileTypeChecker::getFileTypeEx - entry '%s' of '%s' would be read as an "
                              "option; not run\n",
                              entry->d_name, dir.c_str());
                optionName = true;
                break;
            }
        }
        env->closeDirectory(handle);
        if (optionName) return false;

        char* cmd = makeCommand(DIRECTORY_COMMAND, dir.c_str(), function);
        if (cmd == nullptr) return false;
        bool ran = runBatch(cmd, prefix.c_str(), key.c_str(), cache, answer);
        kelm_free(cmd);
        if (!ran) return false;
    } else {
        int entries = makeListFile(dir.c_str(), listFileName);
        char* cmd = nullptr;
        if (entries == 1) {
            char bad = quoteBreaker(narrow.c_str());
            if (bad != 0 || narrow[0] == '-') {
                log->traceMAX(__LINE__, __FILE__, function,
                              "FileTypeChecker::getFileTypeEx_2 - path '%s' would break the quoted "
                              "command; not run\n",
                              narrow.c_str());
                return false;
            }
            cmd = makeCommand(FILE_COMMAND, narrow.c_str(), function);
        } else if (entries > 1) {
            // The list file's name is this object's own, "./kel_cmd_file_" and
            // hex digits: always a safe bare word.
            cmd = makeCommand(LIST_COMMAND, listFileName, function);
        } else {
            return false;
        }
        if (cmd == nullptr) return false;
        bool ran = runBatch(cmd, "", key.c_str(), cache, answer);
        kelm_free(cmd);
        if (!ran) return false;
    }

    if (answer.getID() == EMPTY_ID || answer.getFileTypeInfo() == nullptr) {
        if (listFileMode) {
            log->traceMAX(__LINE__, __FILE__, function,
                          "FileTypeChecker::getFileTypeEx_2 - path file name '%S' not found!\n", path);
        } else {
            log->traceMAX(__LINE__, __FILE__, function,
                          "FileTypeChecker::getFileTypeEx - path file name '%S' not found!\n", path);
        }
        return false;
    }
    *out = answer.releaseFileTypeInfo();
    return true;
}

int FileTypeChecker::makeListFile(char const* dir, char const* listFile) {
    if (dir == nullptr || listFile == nullptr) return -1;
    fscanner::Env* env = fscanner::Env::Current();
    FILE* list = env->openStream(listFile, "w+");
    if (list == nullptr) return -1;
    DIR* handle = env->openDirectory(dir);
    if (handle == nullptr) {
        env->closeStream(list);
        return -1;
    }
    size_t dirLength = strlen(dir);
    bool separator = dirLength == 0 || dir[dirLength - 1] != '/';
    int written = 0;
    bool failed = false;
    for (struct dirent* entry = env->readDirectory(handle); entry != nullptr; entry = env->readDirectory(handle)) {
        // The end mark takes part in the comparison, so ".profile" or "..x"
        // are kept and only "." and ".." themselves are passed over.
        if (memcmp(entry->d_name, ".", 2) == 0 || memcmp(entry->d_name, "..", 3) == 0) continue;
        std::string full(dir);
        if (separator) full += '/';
        full += entry->d_name;
        struct stat status;
        if (env->linkStatus(full.c_str(), &status) != 0) {
            log->traceMAX(__LINE__, __FILE__, "makeListFile", "::makeListFile - stat on '%s' file failed!\n",
                          full.c_str());
            failed = true;
            break;
        }
        if (S_ISDIR(status.st_mode)) continue;
        if (fprintf(list, "%s\n", full.c_str()) < 0) {
            failed = true;
            break;
        }
        ++written;
    }
    env->closeDirectory(handle);
    if (env->closeStream(list) != 0) failed = true;
    return failed ? -1 : written;
}

bool FileTypeChecker::fileTypeSplitter(wchar_t* text, StringList<wchar_t>& words) {
    if (text == nullptr) return false;
    wchar_t* copy = wideDuplicate(text);
    if (copy == nullptr) return false;
    bool any = false;
    bool ok = true;
    wchar_t* state = nullptr;
    for (wchar_t* word = wcstok(copy, L"\n ,:", &state); word != nullptr;
         word = wcstok(nullptr, L"\n ,:", &state)) {
        rtrim(ltrim(word));
        if (!words.insert(word)) {
            ok = false;
            break;
        }
        any = true;
    }
    kelm_free(copy);
    return ok && any;
}

bool FileTypeChecker::checkTypeList(StringList<wchar_t>& fileWords, StringList<wchar_t>& wanted) {
    int wantedCount = static_cast<int>(wanted.size());
    int fileCount = static_cast<int>(fileWords.size());
    for (int i = 0; i < wantedCount; ++i) {
        StringList<wchar_t> words;
        if (!fileTypeSplitter(wanted.at(i), words)) {
            log->traceMAX(__LINE__, __FILE__, "checkTypeList",
                          "FileTypeChecker::checkTypeList - fileTypeSplitter of '%S' failed!\n",
                          wanted.at(i) != nullptr ? wanted.at(i) : L"(null)");
            continue;
        }
        int wordCount = static_cast<int>(words.size());
        for (int j = 0; j < wordCount; ++j) {
            for (int k = 0; k < fileCount; ++k) {
                if (wcscmp(words.at(j), fileWords.at(k)) == 0) return true;
            }
        }
    }
    return false;
}

// The words of the description in line, which must begin with path: what
// stands behind the path, tabs and line feeds made blanks, trimmed.  False
// for an empty description.
bool FileTypeChecker::describeLine(wchar_t const* path, wchar_t const* line, StringList<wchar_t>& words) {
    wchar_t* description = wideDuplicate(line + wcslen(path));
    if (description == nullptr) return false;
    replaceChar(description, tab, L' ');
    replaceChar(description, lineFeed, L' ');
    rtrim(ltrim(description));
    bool ok = description[0] != L'\0' && fileTypeSplitter(description, words);
    kelm_free(description);
    return ok;
}

bool FileTypeChecker::check(wchar_t const* path, StringList<wchar_t>& types) {
    if (types.size() == 0) return true;
    wchar_t* line = nullptr;
    if (!getFileTypeEx(path, &line)) return false;
    StringList<wchar_t> words;
    bool result = describeLine(path, line, words) && checkTypeList(words, types);
    kelm_free(line);
    return result;
}

bool FileTypeChecker::check(wchar_t const* dir, wchar_t const* name, StringList<wchar_t>& types) {
    if (types.size() == 0) return true;
    wchar_t* path = getFullPathName(dir, name);
    if (path == nullptr) return false;
    bool result = check(static_cast<wchar_t const*>(path), types);
    kelm_free(path);
    return result;
}

bool FileTypeChecker::check(wchar_t const* dir, wchar_t const* name, StringList<wchar_t>& include,
                            StringList<wchar_t>& exclude) {
    if (include.size() == 0 && exclude.size() == 0) return true;
    wchar_t* path = getFullPathName(dir, name);
    if (path == nullptr) return false;
    wchar_t* line = nullptr;
    bool result = false;
    if (getFileType(path, &line)) {
        result = check(static_cast<wchar_t const*>(path), line, include, exclude);
        kelm_free(line);
    }
    kelm_free(path);
    return result;
}

bool FileTypeChecker::check(wchar_t const* path, wchar_t* line, StringList<wchar_t>& include,
                            StringList<wchar_t>& exclude) {
    if (path == nullptr || line == nullptr) return false;
    if (include.size() == 0 && exclude.size() == 0) return true;
    if (wcsncmp(line, path, wcslen(path)) != 0) return false;
    StringList<wchar_t> words;
    if (!describeLine(path, line, words)) return false;
    if (exclude.size() != 0 && checkTypeList(words, exclude)) return false;
    if (include.size() == 0) return true;
    return checkTypeList(words, include);
}

bool FileTypeChecker::check(wchar_t const* dir, wchar_t const* name, wchar_t* line,
                            StringList<wchar_t>& include, StringList<wchar_t>& exclude) {
    wchar_t* path = getFullPathName(dir, name);
    bool result = check(static_cast<wchar_t const*>(path), line, include, exclude);
    kelm_free(path);
    return result;
}

int FileTypeChecker::check(wchar_t const* listFile, StringList<wchar_t>& include,
                           StringList<wchar_t>& exclude, std::vector<bool>& results) {
    static char const* const function = "check";
    if (listFile == nullptr) {
        log->traceMAX(__LINE__, __FILE__, function,
                      "FileTypeChecker::check - pathFileName is a null pointer!\n");
        return -1;
    }
    if (include.size() == 0 && exclude.size() == 0) return 0;
    if (lineBuffer == nullptr) return -1;

    std::string name;
    FILE* list = nullptr;
    fscanner::Env* env = fscanner::Env::Current();
    if (toNarrow(listFile, name)) list = env->openStream(name.c_str(), "r");
    if (list == nullptr) {
        log->traceMAX(__LINE__, __FILE__, function, "FileTypeChecker::check - cannot open '%S' data file!\n",
                      listFile);
        return -1;
    }
    // The name stands bare in the command: blanks split it, as they would,
    // but nothing else of the shell's grammar may reach the shell.
    char bad = bareWordBreaker(name.c_str());
    if (bad != 0 || name[0] == '-') {
        log->traceMAX(__LINE__, __FILE__, function,
                      "FileTypeChecker::check - list file name '%s' holds shell syntax (0x%02x) or begins "
                      "with '-'; not run\n",
                      name.c_str(), static_cast<unsigned int>(static_cast<unsigned char>(bad)));
        env->closeStream(list);
        return -1;
    }
    char* cmd = makeCommand(LIST_COMMAND, name.c_str(), function);
    if (cmd == nullptr) {
        env->closeStream(list);
        return -1;
    }
    FILE* pipe = openCommand(cmd, function);
    kelm_free(cmd);
    if (pipe == nullptr) {
        env->closeStream(list);
        return -1;
    }

    std::vector<wchar_t> path(BUFFER_SIZE);
    int count = 0;
    while (fgets(buffer, BUFFER_SIZE, pipe) != nullptr && fgets(lineBuffer, BUFFER_SIZE, list) != nullptr) {
        toWide(buffer, wbuffer, BUFFER_SIZE);
        bool result = false;
        if (toWide(lineBuffer, path.data(), path.size())) {
            replaceChar(path.data(), tab, L' ');
            replaceChar(path.data(), lineFeed, L' ');
            rtrim(ltrim(path.data()));
            result = check(static_cast<wchar_t const*>(path.data()), wbuffer, include, exclude);
        }
        results.push_back(result);
        ++count;
    }
    fscanner::Env::Current()->closePipe(pipe);
    env->closeStream(list);
    return count;
}

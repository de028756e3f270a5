// The file type check: asks the system's `file` command, through a shell, how
// it describes a file, cuts the description into words and compares them with
// the words a caller wants ("ELF", "script", "text", ...).  Nothing here looks
// at a file's content itself, and the library holds no table of file types:
// the wanted words come from the caller's rules.
//
// Starting a shell per file is slow, so the common path (getFileTypeEx)
// classifies a whole directory in one run and keeps the answers it was not
// asked for in a process-wide FileTypeCache until they are asked for, once.
//
// The commands are fixed texts and quote the path without escaping it.  A
// path that would break out of those quotes, or that the shell would read as
// an option, is refused before any shell is started: the check then answers
// false, as the broken command would, and traces why.
//
// Threads: the two process-wide caches, the batch number and each object's
// buffers are unguarded.  One thread at a time.
#ifndef FSCANNER_FSCOMMON_FILETYPEHELPER_H
#define FSCANNER_FSCOMMON_FILETYPEHELPER_H

#include <cstdio>
#include <cwchar>
#include <list>
#include <vector>

#include "fscanner/fscommon/strlist.h"

class QvLogWrapper;

// One cached answer of `file`: the number of the batch (one run of the
// directory command) it came from, and the whole output line.  An empty
// Element has id -1 and no text.  The text is owned, from kelm_malloc, and
// copied deeply by copy and assignment.
class Element {
public:
    Element();
    // Copies text (null allowed).
    Element(int id, wchar_t const* text);
    Element(Element const& other);
    Element& operator=(Element const& other);
    ~Element();

    int getID() const;
    // The owned line, or null; stays owned by the Element.
    wchar_t* getFileTypeInfo() const;
    // Replaces id and text.  copy true: the text is duplicated and the caller
    // keeps its block.  copy false: the Element takes the block, which must
    // come from kelm_malloc.  A failed duplication leaves the text null.
    void setData(int id, wchar_t* text, bool copy);
    // Hands the owned text to the caller (release with kelm_free) and leaves
    // the Element without text; the id stays.
    wchar_t* releaseFileTypeInfo();

private:
    int id;
    wchar_t* fileTypeInfo;
};

// Answers of `file` kept in order of insertion.  When full, whole batches are
// dropped from the oldest end, but never the batch of the element being
// inserted: dropping stops when the oldest entry is of that batch, so a
// directory being read is kept whole even beyond capacity.
class FileTypeCache {
public:
    static constexpr unsigned int MIN_CAPACITY = 4096;

    // A capacity below MIN_CAPACITY is raised to it.
    explicit FileTypeCache(unsigned int capacity = MIN_CAPACITY);

    // Appends a copy of element after making room (see the class comment) and
    // notes its batch as the last one.
    void insert(Element const& element);
    // Searches from the oldest entry for one whose text begins with key.  A
    // hit is removed and returned, so every answer serves once; a miss (or a
    // null key) gives an empty Element.  The flag has no effect.
    Element find(wchar_t const* key, bool flag);
    // Traces every entry as "[id] - text" at the highest trace level.
    void print();

    // Inspection, for tests and diagnostics.
    unsigned int getCapacity() const;
    int getLastBatchId() const;
    size_t size() const;
    // Drops every entry and forgets the last batch.
    void clear();

private:
    unsigned int capacity;
    int lastBatchId;
    std::list<Element> elements;
};

class FileTypeChecker {
public:
    // Size of the narrow and wide work buffers and of the single-line block;
    // no line of `file` output or of a list file is read beyond it.
    static constexpr unsigned int BUFFER_SIZE = 8192;
    // Longest path, in characters, that getFileTypeEx and getFileTypeEx_2 take.
    static constexpr unsigned int MAX_PATH_CHARS = 4095;

    // The three command texts, as printf formats of one narrow string.  The
    // blanks are irregular and stay so.  LANG=C keeps the descriptions in
    // English whatever the locale, so that the wanted words stay valid.
    // One file, the path in double quotes:
    static const char FILE_COMMAND[];
    // A whole directory, the directory in double quotes:
    static const char DIRECTORY_COMMAND[];
    // A list file of paths, one a line; the list file's name stands bare:
    static const char LIST_COMMAND[];

    // The list file of getFileTypeEx_2 is "./kel_cmd_file_%x" of the object's
    // address, relative to the working directory, and stays behind there.
    FileTypeChecker();
    ~FileTypeChecker();
    FileTypeChecker(FileTypeChecker const&) = delete;
    FileTypeChecker& operator=(FileTypeChecker const&) = delete;

    // Runs `file` on one path and gives, in *out, a new string (kelm_malloc,
    // the caller releases it with kelm_free) with the first output line that
    // begins with the path, line feed included.  False when no line does, the
    // path is refused, or the command can't be run; *out is then untouched.
    bool getFileType(wchar_t const* path, wchar_t** out);
    // The same answer through the directory batch: a cached line of an
    // earlier run if there is one (it is consumed), else one run of `file`
    // over every non-hidden entry of the path's directory, whose other lines
    // go into the cache.  Paths of more than MAX_PATH_CHARS characters and
    // paths without "/" give false.
    bool getFileTypeEx(wchar_t const* path, wchar_t** out);
    // As getFileTypeEx, but the directory is listed into the list file by
    // makeListFile and classified by the list command (or by the one-file
    // command when the directory holds a single entry).  A cache of its own.
    bool getFileTypeEx_2(wchar_t const* path, wchar_t** out);

    // Cuts a copy of text at line feed, blank, "," and ":" and appends every
    // word to words.  False for a null text, a failed allocation, or no word.
    bool fileTypeSplitter(wchar_t* text, StringList<wchar_t>& words);
    // True when some word of some wanted entry equals (wcscmp) one of
    // fileWords.  An entry of several words thus means any of them.
    bool checkTypeList(StringList<wchar_t>& fileWords, StringList<wchar_t>& wanted);

    // Note on the overloads: a second argument of type wchar_t* selects the
    // forms that take a `file` line in hand; wchar_t const* selects a name.

    // Whether the path's description holds a wanted word, through
    // getFileTypeEx.  An empty list is true without running anything.
    bool check(wchar_t const* path, StringList<wchar_t>& types);
    // The same on dir joined with name.
    bool check(wchar_t const* dir, wchar_t const* name, StringList<wchar_t>& types);
    // Include and exclude through one getFileType run on dir joined with
    // name.  Both lists empty: true before anything is run.
    bool check(wchar_t const* dir, wchar_t const* name, StringList<wchar_t>& include,
               StringList<wchar_t>& exclude);
    // On a `file` line in hand; nothing is run.  Null path or line: false.
    // Both lists empty: true.  The line must begin with the path; its empty
    // description is false; a hit in exclude is false (exclude wins); then an
    // empty include is true, else a hit in include decides.
    bool check(wchar_t const* path, wchar_t* line, StringList<wchar_t>& include,
               StringList<wchar_t>& exclude);
    // The same on dir joined with name.
    bool check(wchar_t const* dir, wchar_t const* name, wchar_t* line,
               StringList<wchar_t>& include, StringList<wchar_t>& exclude);
    // A whole list file: runs the list command once and checks each output
    // line against the list's line in the same place, appending one result
    // per pair to results.  Stops at the end of either.  Relies on `file -f`
    // answering the list's lines in order, one line each.  Gives the number
    // of results appended; 0 when both lists are empty (nothing is run); -1
    // for a null name, an unreadable list, a refused name or a failed run.
    int check(wchar_t const* listFile, StringList<wchar_t>& include,
              StringList<wchar_t>& exclude, std::vector<bool>& results);

    // Writes the full path of every entry of dir that is not a directory
    // (hidden ones too; "." and ".." are passed over) into listFile, one a
    // line, and gives how many it wrote; -1 on any failure.
    int makeListFile(char const* dir, char const* listFile);

    // This object's list file name.
    char const* getListFileName() const;

    // The process-wide caches of getFileTypeEx and getFileTypeEx_2, and the
    // number the next batch will carry (1 to 65536, moved on after each run).
    static FileTypeCache& batchCache();
    static FileTypeCache& listCache();
    static int currentBatch();

private:
    bool runBatch(char const* cmd, char const* prefix, wchar_t const* key, FileTypeCache& cache,
                  Element& answer);
    bool lookUpInDirectory(wchar_t const* path, wchar_t** out, bool listFileMode);
    bool describeLine(wchar_t const* path, wchar_t const* line, StringList<wchar_t>& words);
    char* makeCommand(char const* format, char const* argument, char const* function);
    FILE* openCommand(char const* cmd, char const* function);

    char buffer[BUFFER_SIZE];
    wchar_t wbuffer[BUFFER_SIZE];
    char* lineBuffer;
    wchar_t tab;
    wchar_t lineFeed;
    char listFileName[64];
    QvLogWrapper* log;
};

#endif

// FS_Table::compact: copies the live records of a closed table into a fresh
// "<name>_cpt" table, rebuilds the indexes there and swaps the files in.
//
// Until the index swap starts the original files are untouched, so a process
// that dies during the copy leaves a table that opens and reads whole; the
// "_cpt" leftovers are replaced by the next attempt.
#include "fscanner/fscommon/table.h"

#include <cstring>
#include <cwchar>

#include "base/QvLogWrapper.h"
#include "base/kelmem.h"
#include "fscanner/fscommon/cache_files.h"
#include "fscanner/fscommon/stringhelper.h"

void (*FS_Table::compactCopyHook)(unsigned int copied) = nullptr;

namespace {

// The results of remove and rename are not looked at: what a failure leaves
// is the state a crash at that point would leave.
void removeWide(wchar_t const* path) {
    if (path != nullptr) removeFile(const_cast<wchar_t*>(path));
}

void renameWide(wchar_t const* from, wchar_t const* to) {
    if (from != nullptr && to != nullptr) renameFile(const_cast<wchar_t*>(from), const_cast<wchar_t*>(to));
}

}  // namespace

bool FS_Table::compact(int percent) {
    QvLogWrapper* log = getQvLogFs();
    if (dataFile != nullptr || pointerFile != nullptr) return false;
    if (!open()) return false;

    unsigned int deleted = 0, stored = 0;
    if (!count(1, &deleted) || !count(0, &stored)) {
        close();
        return false;
    }
    log->traceMID(__LINE__, __FILE__, __FUNCTION__, "FS_Table::compact - [%d] [stored: %d] [deleted: %d]\n",
                  percent, static_cast<int>(stored), static_cast<int>(deleted));

    // Signed 32-bit arithmetic, wrapping as the stored words would.
    int share = static_cast<int>(static_cast<unsigned int>(percent) * stored) / 100;
    if (share >= static_cast<int>(deleted)) {
        close();
        log->traceMID(__LINE__, __FILE__, __FUNCTION__, "FS_Table::compact - [%ls] table compact skipped!\n",
                      name);
        return true;
    }
    log->traceMID(__LINE__, __FILE__, __FUNCTION__, "FS_Table::compact - performing [%ls] table compact...\n",
                  name);

    wchar_t* tempName = cachefiles::compactionName(name);
    if (tempName == nullptr) {
        close();
        return false;
    }
    FS_Table* temp = new FS_Table(tempName, directory, compressed);
    kelm_free(tempName);
    Fields buffer(schema);
    for (unsigned int i = 0; i < schema.count(); ++i)
        temp->addField(schema.at(i)->getName(), schema.at(i)->getType());

    bool ok = temp->create();
    if (ok) {
        for (Index* index : indexes) {
            wchar_t* tempIndex = cachefiles::compactionName(index->getIndexName());
            if (tempIndex != nullptr) temp->addHashIndex(tempIndex, index->getFieldName());
            kelm_free(tempIndex);
        }
        ok = temp->getIndexes().size() == indexes.size();
    }
    if (!ok) {
        // This table is untouched; the temporary data, pointer and index files
        // stay on disk for the next attempt's create() and addHashIndex to
        // replace, only the temporary index list goes.
        close();
        temp->close();
        temp->eraseHashIndexList(temp->getIndexes());
        delete temp;
        return false;
    }

    // Copy: numbers become dense in the new table; inserts fill its indexes.
    unsigned int copied = 0;
    unsigned int id = 0;
    bool more = moveFirst(id);
    while (more) {
        read(id, buffer);
        if (!temp->insert(buffer)) {
            // A full disk: the copy would lack records, so it is dropped
            // whole (which gives the space back) and this table stays as it
            // is.
            close();
            temp->close();
            temp->erase();
            delete temp;
            return false;
        }
        ++copied;
        if (compactCopyHook != nullptr) compactCopyHook(copied);
        more = moveNext(id);
    }

    // Swap the indexes in, position by position.
    std::vector<Index*>& fresh = temp->getIndexes();
    for (size_t i = 0; i < indexes.size() && i < fresh.size(); ++i) {
        indexes[i]->close();
        indexes[i]->erase();
        fresh[i]->close();
        renameWide(fresh[i]->getIndexFullPathName(), indexes[i]->getIndexFullPathName());
    }

    close();
    temp->close();
    temp->eraseHashIndexList(temp->getIndexes());

    removeWide(dataPath);
    removeWide(pointerPath);
    renameWide(temp->getDataPath(), dataPath);
    renameWide(temp->getPointerPath(), pointerPath);

    delete temp;
    return true;
}

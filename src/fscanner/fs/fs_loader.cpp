// Settings, provider loading and the clean-up list.  See fs_loader.h.
#include "fscanner/fs/fs_loader.h"

#include <dlfcn.h>

#include <cstdint>
#include <cstdio>
#include <cstdlib>
#include <cstring>

#include "base/KelCfg.h"
#include "base/QvLogWrapper.h"
#include "fscanner/fscommon/env.h"

const char* createProviderSymbol = "createProvider";

FsConfig::~FsConfig() {}

FsConfig_KEL::FsConfig_KEL() {}

FsConfig_KEL::~FsConfig_KEL() {}

String FsConfig_KEL::getError() const { return KelCfg::getError(); }

std::string FsConfig_KEL::getString(const char* section, const char* key, const char* defaultValue) const {
    std::string result = defaultValue != nullptr ? defaultValue : "";
    std::string name = section != nullptr ? section : "";
    name += ".";
    name += key != nullptr ? key : "";
    String value = KelCfg::getKey(String(name.c_str()));
    if (value.length() > 0) result = static_cast<const char*>(value);
    return result;
}

int FsConfig_KEL::getInteger(const char* section, const char* key, int defaultValue) const {
    std::string text = getString(section, key, nullptr);
    const char* p = text.c_str();

    bool negative = false;
    while (*p == '-' || *p == '+') {
        if (*p == '-') negative = !negative;
        ++p;
    }
    if (*p < '0' || *p > '9') return defaultValue;

    // Unsigned arithmetic: digits beyond 32 bits wrap instead of overflowing.
    uint32_t value = 0;
    while (*p >= '0' && *p <= '9') {
        value = value * 10u + static_cast<uint32_t>(*p - '0');
        ++p;
    }
    uint32_t multiplier = 1;
    if (*p == 'K' || *p == 'k') {
        multiplier = 1024u;
        ++p;
    } else if (*p == 'M' || *p == 'm') {
        multiplier = 1048576u;
        ++p;
    }
    if (*p != '\0') return defaultValue;

    value *= multiplier;
    if (negative) value = 0u - value;
    return static_cast<int>(static_cast<int32_t>(value));
}

void* loadLibraryAndFactory(const char* name, const FsConfig* config, const char* symbol, void** handle) {
    QvLogWrapper* log = getQvLogFs();
    if (handle != nullptr) *handle = nullptr;
    if (config == nullptr) {
        log->traceMIN(__LINE__, __FILE__, __FUNCTION__, "loadLibraryAndFactory - no configuration given\n");
        return nullptr;
    }

    std::string prefix = config->getString("fscanner", "home", ".");
    prefix += "/";
    log->traceMAX(__LINE__, __FILE__, __FUNCTION__, "DLL prefix = %s\n", prefix.c_str());

    const size_t kNameBufferSize = 2000;
    if (name == nullptr || name[0] == '\0') return nullptr;
    if (std::strlen(name) + 3 + prefix.size() >= kNameBufferSize) return nullptr;
    if (symbol == nullptr) {
        log->traceMIN(__LINE__, __FILE__, __FUNCTION__, "loadLibraryAndFactory - no symbol given\n");
        return nullptr;
    }

    char fileName[kNameBufferSize];
    std::snprintf(fileName, sizeof(fileName), "%s%s%s", prefix.c_str(), name, ".so");

    fscanner::Env* env = fscanner::Env::Current();
    void* library = env->loadLibrary(fileName, RTLD_NOW);
    if (library == nullptr) {
        const char* reason = env->libraryError();
        log->traceMIN(__LINE__, __FILE__, __FUNCTION__, "*** Error: cannot load DLL '%s' (%s)\n", fileName,
                      reason != nullptr ? reason : "");
        return nullptr;
    }
    // A library without the symbol stays loaded; only the handle is withheld.
    void* address = env->findSymbol(library, symbol);
    if (address == nullptr) return nullptr;
    if (handle != nullptr) *handle = library;
    return address;
}

void* FsLoader::loadFsProvider(const char* name, const FsConfig* config) {
    QvLogWrapper* log = getQvLogFs();
    log->traceMidEntry(__LINE__, __FILE__, __FUNCTION__, "FsLoader::loadFsProvider - entering...\n");
    void* handle = nullptr;
    void* provider = nullptr;
    void* factory = loadLibraryAndFactory(name, config, createProviderSymbol, &handle);
    if (factory != nullptr) {
        FsProviderFactory create = reinterpret_cast<FsProviderFactory>(factory);
        provider = create(config);
    }
    // The handle is dropped on purpose: a provider is never unloaded.
    log->traceMidExit(__LINE__, __FILE__, __FUNCTION__, "FsLoader::loadFsProvider - exit\n");
    return provider;
}

namespace {
FsResourceManager* resourceManagerInstance = nullptr;
}

FsResourceManager::FsResourceManager() : head(nullptr) {}

FsResourceManager::~FsResourceManager() {
    while (head != nullptr) {
        Entry* next = head->next;
        delete head;
        head = next;
    }
}

void FsResourceManager::destroyInstance() {
    delete resourceManagerInstance;
    resourceManagerInstance = nullptr;
}

FsResourceManager* FsResourceManager::getInstance() {
    if (resourceManagerInstance == nullptr) {
        resourceManagerInstance = new FsResourceManager();
        std::atexit(&FsResourceManager::destroyInstance);
    }
    return resourceManagerInstance;
}

void FsResourceManager::addCleanupHandler(CleanupHandler handler, void* data) {
    Entry* entry = new Entry;
    entry->handler = handler;
    entry->data = data;
    entry->next = head;
    head = entry;
}

void FsResourceManager::removeCleanupHandler(CleanupHandler handler, void* data) {
    Entry** link = &head;
    while (*link != nullptr) {
        Entry* entry = *link;
        if (entry->handler == handler && entry->data == data) {
            *link = entry->next;
            delete entry;
            return;
        }
        link = &entry->next;
    }
}

void FsResourceManager::invokeCleanupHandlers(int code) {
    for (Entry* entry = head; entry != nullptr; entry = entry->next) {
        if (entry->handler != nullptr) entry->handler(code, entry->data);
    }
}

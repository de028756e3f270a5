// Settings, provider loading and process-exit clean-up: the three small
// services at the library's edge.
//
// FsConfig is the abstract source of settings; FsConfig_KEL reads them from
// the host's configuration store (KelCfg), which holds all its state.
// loadLibraryAndFactory / FsLoader load a provider library from the directory
// named by "fscanner.home" and find its factory.  FsResourceManager keeps the
// clean-up handlers that long-lived objects register for the host's exit.
#ifndef FSCANNER_FS_FS_LOADER_H
#define FSCANNER_FS_FS_LOADER_H

#include <string>

#include "base/String.h"

// Abstract source of settings.  A value is addressed by a section and a key.
class FsConfig {
public:
    virtual ~FsConfig();
    // Text of the last configuration error; empty when there is none.
    virtual String getError() const = 0;
    // The value as an integer (see FsConfig_KEL), or defaultValue when the
    // key is missing, empty or not a number.
    virtual int getInteger(const char* section, const char* key, int defaultValue) const = 0;
    // The value as text, or defaultValue (empty for null) when the key is
    // missing or empty.
    virtual std::string getString(const char* section, const char* key, const char* defaultValue) const = 0;
};

// Settings from KelCfg, under the key "<section>.<key>".  No data of its own;
// safe to use from any thread as KelCfg is.
class FsConfig_KEL : public FsConfig {
public:
    FsConfig_KEL();
    ~FsConfig_KEL() override;
    // What KelCfg::getError() returns.
    String getError() const override;
    // Reads the text through getString, then accepts: any run of leading "-"
    // (each flips the sign) and "+" (skipped); decimal digits into a 32-bit
    // value without an overflow test; one optional suffix "K"/"k" (x 1,024)
    // or "M"/"m" (x 1,048,576).  Anything else, a text without digits or a
    // character behind the suffix gives defaultValue.
    int getInteger(const char* section, const char* key, int defaultValue) const override;
    // An empty value and a missing key are the same: both give defaultValue.
    std::string getString(const char* section, const char* key, const char* defaultValue) const override;
};

// Name of the factory function every provider library exports: "createProvider".
extern const char* createProviderSymbol;

// Signature of a provider factory: it receives the configuration and returns
// the provider object, whose type the host knows.
typedef void* (*FsProviderFactory)(const FsConfig* config);

// Loads "<fscanner.home or .>/<name>.so" with immediate binding and returns
// the address of symbol in it, or null.  When handle is not null it receives
// the library handle, or null on any failure (a library whose symbol is
// missing stays loaded all the same).  Fails without loading for a null or
// empty name, a null config or symbol, or a file name of 2,000 bytes or more.
void* loadLibraryAndFactory(const char* name, const FsConfig* config, const char* symbol, void** handle);

class FsLoader {
public:
    // Loads the provider library name and calls its createProvider with
    // config.  Returns what the factory returns, or null when the library or
    // its factory cannot be found.  The library is never unloaded.
    static void* loadFsProvider(const char* name, const FsConfig* config);
};

// Process-wide list of clean-up handlers, invoked last registered first.
// No lock: registration and invocation must not overlap.
class FsResourceManager {
public:
    typedef void (*CleanupHandler)(int code, void* data);

    // The one instance, made at first use and destroyed at process exit
    // (without calling the handlers).
    static FsResourceManager* getInstance();

    // Puts (handler, data) at the head of the list.  A pair registered twice
    // is held, and invoked, twice.
    void addCleanupHandler(CleanupHandler handler, void* data);
    // Removes the first entry with this handler and this data; nothing when
    // there is none.
    void removeCleanupHandler(CleanupHandler handler, void* data);
    // Calls every entry from the head with (code, data).  The entries stay,
    // so a second call invokes them again.
    void invokeCleanupHandlers(int code);

    // Frees the entries without calling them.
    ~FsResourceManager();

private:
    FsResourceManager();
    FsResourceManager(const FsResourceManager&) = delete;
    FsResourceManager& operator=(const FsResourceManager&) = delete;

    struct Entry {
        CleanupHandler handler;
        void* data;
        Entry* next;
    };

    static void destroyInstance();

    Entry* head;
};

#endif

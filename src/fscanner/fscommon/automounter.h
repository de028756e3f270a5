// Reader of the automounter's configuration: the master file and the plain
// text maps it names.  It sorts every map entry into a local or a remote
// mount directory by the look of its location, so that the drive list can
// know remote automounter mount points without waking them.
//
// Failures travel as thrown std::string values, the only exceptions this
// library raises itself.  A failure in the master file ends the parse (the
// caller catches it); a failure in one map is caught and traced inside
// handleEntry and skips only the rest of that map.
//
// No object here has a lock; use one parser per thread.
#ifndef FSCANNER_FSCOMMON_AUTOMOUNTER_H
#define FSCANNER_FSCOMMON_AUTOMOUNTER_H

#include <fstream>
#include <string>
#include <vector>

class QvLogWrapper;

// One map source named by the master file.
class ParserDelegate {
public:
    ParserDelegate(const std::string& mapType, const std::string& mapPath, const std::string& mapFormat,
                   const std::string& mountPoint);
    virtual ~ParserDelegate();
    // Appends the mount directories of the map to remote or local.  Throws a
    // std::string when the map cannot be read; entries sorted before the
    // failure stay in the lists.
    virtual void parse(std::vector<std::string>& remote, std::vector<std::string>& local) = 0;

protected:
    std::string mapType;
    std::string mapPath;
    std::string mapFormat;
    std::string mountPoint;
};

// A map held in a flat text file, one "key [options] location" entry a line.
class PlainFileParser : public ParserDelegate {
public:
    PlainFileParser(const std::string& mapType, const std::string& mapPath, const std::string& mapFormat,
                    const std::string& mountPoint);
    ~PlainFileParser() override;
    // Throws "Unable to open automounter map file: <path>" or "Unknown map
    // file format" (a line of fewer than two tokens).
    void parse(std::vector<std::string>& remote, std::vector<std::string>& local) override;
    // True when the entry's location (its last token) is remote: it does not
    // begin with ":" and holds a ":" (host:/path), or it begins with "://".
    // Precondition: tokens is not empty.
    static bool isRemote(const std::vector<std::string>& tokens);
};

class AutomounterConfigParser {
public:
    static const char* const DEFAULT_MASTER_PATH;  // "/etc/auto.master"

    // masterPath names the master file; tests point it at a fixture.
    explicit AutomounterConfigParser(const std::string& masterPath = DEFAULT_MASTER_PATH);
    virtual ~AutomounterConfigParser();

    // Opens the master file, runs parseMaster and closes it.  Throws
    // "Unable to open automounter's master file <path>" when it cannot be
    // opened, and passes on what parseMaster throws.
    void parse();
    // Reads the master file line by line.  Throws "Automounter master file
    // is of unknown format" for a line of fewer than two tokens and "Unknown
    // format of automounter master file" for a definition of more than three
    // parts.  Lines that are empty or begin with "#" or "+" are skipped.
    // A host's stream is read as it stands; parse() itself reads the master
    // file through the Env.
    void parseMaster(std::ifstream& master);
    // Follows one master entry: a map of type "file" is read by a
    // PlainFileParser; any other type is traced as not supported.  A string
    // thrown by the map parser is caught and traced here.
    void handleEntry(std::string mapType, std::string mapPath, std::string mapFormat, std::string mountPoint);

    // Mount directories sorted so far, in file order.
    const std::vector<std::string>& getLocalMountPoints() const { return localMountPoints; }
    const std::vector<std::string>& getRemoteMountPoints() const { return remoteMountPoints; }
    const std::string& getMasterPath() const { return masterPath; }

private:
    // The work of parseMaster, over lines already read.
    void parseMasterLines(const std::vector<std::string>& lines);

    std::vector<std::string> localMountPoints;
    std::vector<std::string> remoteMountPoints;
    std::string masterPath;
    QvLogWrapper* qvLog;
};

#endif

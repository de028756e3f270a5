// Tests of the automounter master file and map reader, on fixtures in
// temporary directories.
#include <gtest/gtest.h>

#include <string>
#include <vector>

#include "fscanner/fscommon/automounter.h"
#include "support/testsupport.h"

using testsupport::TempDir;
using testsupport::TraceCapture;

namespace {

typedef std::vector<std::string> Strings;

// Runs parse(); returns the thrown text, empty if none.
std::string parseCatching(AutomounterConfigParser& parser) {
    try {
        parser.parse();
    } catch (const std::string& failure) {
        return failure;
    } catch (...) {
        return "unexpected exception type";
    }
    return "";
}

}  // namespace

TEST(AutomounterConfigParser, DefaultMasterFileIsEtcAutoMaster) {
    AutomounterConfigParser parser;
    EXPECT_EQ(parser.getMasterPath(), "/etc/auto.master");
    EXPECT_STREQ(AutomounterConfigParser::DEFAULT_MASTER_PATH, "/etc/auto.master");
}

TEST(AutomounterConfigParser, MissingMasterFileThrows) {
    TempDir dir;
    std::string master = dir.file("no.master");
    AutomounterConfigParser parser(master);
    EXPECT_EQ(parseCatching(parser), "Unable to open automounter's master file " + master);
    EXPECT_TRUE(parser.getLocalMountPoints().empty());
    EXPECT_TRUE(parser.getRemoteMountPoints().empty());
}

TEST(AutomounterConfigParser, SortsEntriesOfAFileMap) {
    TempDir dir;
    std::string map = dir.write("auto.misc",
                                "# a comment\n"
                                "\n"
                                "cd -fstype=iso9660,ro :/dev/cdrom\n"
                                "data server:/export/data\n"
                                "*   server:/export/&\n");
    std::string master = dir.write("auto.master", "/misc " + map + "\n");
    TraceCapture capture;
    AutomounterConfigParser parser(master);
    EXPECT_EQ(parseCatching(parser), "");
    EXPECT_EQ(parser.getLocalMountPoints(), (Strings{"/misc/cd"}));
    EXPECT_EQ(parser.getRemoteMountPoints(), (Strings{"/misc/data", "/misc"}));
    EXPECT_TRUE(capture.contains("Master file entry '/misc " + map + "'")) << capture.dump();
    EXPECT_TRUE(capture.contains("Map mountpoint '/misc', definition '" + map)) << capture.dump();
    EXPECT_TRUE(capture.contains("Map entry: 'cd -fstype=iso9660,ro :/dev/cdrom'")) << capture.dump();
    EXPECT_TRUE(capture.contains("Mountpoint '/misc/cd' recognized as local")) << capture.dump();
    EXPECT_TRUE(capture.contains("Mountpoint '/misc/data' recognized as remote")) << capture.dump();
    EXPECT_TRUE(capture.contains("Mountpoint '/misc' recognized as remote")) << capture.dump();
}

TEST(AutomounterConfigParser, MapDefinitionTraceKeepsItsMissingQuote) {
    TempDir dir;
    std::string map = dir.write("auto.misc", "");
    std::string master = dir.write("auto.master", "/misc " + map + "\n");
    TraceCapture capture;
    AutomounterConfigParser parser(master);
    parser.parse();
    std::vector<QvLogWrapper::Message> messages = capture.messages();
    bool found = false;
    for (const QvLogWrapper::Message& m : messages) {
        if (m.text == "Map mountpoint '/misc', definition '" + map) found = true;
    }
    EXPECT_TRUE(found) << capture.dump();
}

TEST(AutomounterConfigParser, PlusLineIsSkippedWithoutFollowingIt) {
    TempDir dir;
    std::string map = dir.write("auto.misc", "cd :/dev/cdrom\n");
    std::string master = dir.write("auto.master", "+auto.master\n/misc auto.misc\n");
    TraceCapture capture;
    AutomounterConfigParser parser(master);
    EXPECT_EQ(parseCatching(parser), "");
    EXPECT_EQ(parser.getLocalMountPoints(), (Strings{"/misc/cd"}));
    EXPECT_TRUE(parser.getRemoteMountPoints().empty());
    EXPECT_TRUE(capture.contains("Master file entry '+auto.master'")) << capture.dump();
    EXPECT_EQ(capture.count("mapType="), 1u) << capture.dump();
    EXPECT_FALSE(capture.contains("Map mountpoint '+auto.master'")) << capture.dump();
}

TEST(AutomounterConfigParser, CommentAndEmptyLinesAreSkippedButIndentedCommentIsNot) {
    TempDir dir;
    std::string master = dir.write("auto.master",
                                   "# comment\n"
                                   "\n"
                                   "  # indented\n");
    TraceCapture capture;
    AutomounterConfigParser parser(master);
    EXPECT_EQ(parseCatching(parser), "");
    // The indented line is an entry with mount point "#" and a relative map
    // "indented" beside the master file, which does not exist.
    EXPECT_TRUE(capture.contains("Map mountpoint '#', definition 'indented")) << capture.dump();
    EXPECT_TRUE(capture.contains("Map parsing failed: Unable to open automounter map file: " + dir.file("indented")))
        << capture.dump();
    EXPECT_EQ(capture.count("Map mountpoint"), 1u) << capture.dump();
}

TEST(AutomounterConfigParser, SingleTokenLineThrowsAndEndsTheParse) {
    TempDir dir;
    std::string map = dir.write("auto.misc", "data server:/export/data\n");
    std::string master = dir.write("auto.master", "/misc\n/misc " + map + "\n");
    AutomounterConfigParser parser(master);
    EXPECT_EQ(parseCatching(parser), "Automounter master file is of unknown format");
    EXPECT_TRUE(parser.getRemoteMountPoints().empty());
}

TEST(AutomounterConfigParser, BlankOnlyLineIsNotEmptyAndThrows) {
    TempDir dir;
    std::string master = dir.write("auto.master", " \t \n");
    AutomounterConfigParser parser(master);
    EXPECT_EQ(parseCatching(parser), "Automounter master file is of unknown format");
}

TEST(AutomounterConfigParser, EntriesBeforeAMasterFailureStayCollected) {
    TempDir dir;
    std::string map = dir.write("auto.misc", "data server:/export/data\n");
    std::string master = dir.write("auto.master", "/misc " + map + "\nbroken\n");
    AutomounterConfigParser parser(master);
    EXPECT_EQ(parseCatching(parser), "Automounter master file is of unknown format");
    EXPECT_EQ(parser.getRemoteMountPoints(), (Strings{"/misc/data"}));
}

TEST(AutomounterConfigParser, OnePartDefinitionIsFileMapWithEmptyFormat) {
    TempDir dir;
    std::string map = dir.write("auto.misc", "");
    std::string master = dir.write("auto.master", "/misc " + map + "\n");
    TraceCapture capture;
    AutomounterConfigParser parser(master);
    EXPECT_EQ(parseCatching(parser), "");
    EXPECT_TRUE(capture.contains("mapType='file', mapPath='" + map + "', mapFormat='', mountPoint='/misc'"))
        << capture.dump();
    EXPECT_FALSE(capture.contains("Map parsing failed")) << capture.dump();
}

TEST(AutomounterConfigParser, TwoPartDefinitionTakesTypeFromFirstPart) {
    TempDir dir;
    std::string map = dir.write("auto.misc", "cd :/dev/cdrom\n");
    std::string master = dir.write("auto.master", "/misc file:" + map + "\n");
    TraceCapture capture;
    AutomounterConfigParser parser(master);
    EXPECT_EQ(parseCatching(parser), "");
    EXPECT_TRUE(capture.contains("mapType='file', mapPath='" + map + "', mapFormat='', mountPoint='/misc'"))
        << capture.dump();
    EXPECT_EQ(parser.getLocalMountPoints(), (Strings{"/misc/cd"}));
}

TEST(AutomounterConfigParser, ThreePartDefinitionAlsoSetsFormat) {
    TempDir dir;
    std::string map = dir.write("auto.misc", "cd :/dev/cdrom\n");
    std::string master = dir.write("auto.master", "/misc file,sun:" + map + "\n");
    TraceCapture capture;
    AutomounterConfigParser parser(master);
    EXPECT_EQ(parseCatching(parser), "");
    EXPECT_TRUE(capture.contains("mapType='file', mapPath='" + map + "', mapFormat='sun', mountPoint='/misc'"))
        << capture.dump();
    EXPECT_EQ(parser.getLocalMountPoints(), (Strings{"/misc/cd"}));
}

TEST(AutomounterConfigParser, MoreThanThreePartsThrows) {
    TempDir dir;
    std::string master = dir.write("auto.master", "/misc file,sun,x:/etc/auto.misc\n");
    AutomounterConfigParser parser(master);
    EXPECT_EQ(parseCatching(parser), "Unknown format of automounter master file");
}

TEST(AutomounterConfigParser, DefinitionOfSeparatorsOnlyThrows) {
    TempDir dir;
    std::string master = dir.write("auto.master", "/misc ,:\n");
    AutomounterConfigParser parser(master);
    EXPECT_EQ(parseCatching(parser), "Unknown format of automounter master file");
}

TEST(AutomounterConfigParser, NisMapIsTracedAsNotSupported) {
    TempDir dir;
    // Even a readable file of that name is not read for a "nis" map.
    dir.write("auto.misc", "data server:/export/data\n");
    std::string master = dir.write("auto.master", "/misc nis:auto.misc\n");
    TraceCapture capture;
    AutomounterConfigParser parser(master);
    EXPECT_EQ(parseCatching(parser), "");
    EXPECT_TRUE(capture.contains("Map type 'nis' not supported.")) << capture.dump();
    EXPECT_TRUE(capture.contains("mapType='nis', mapPath='" + dir.file("auto.misc") + "'")) << capture.dump();
    EXPECT_TRUE(parser.getRemoteMountPoints().empty());
    EXPECT_TRUE(parser.getLocalMountPoints().empty());
}

TEST(AutomounterConfigParser, NotSupportedTraceGoesOutAtMinimumLevel) {
    TempDir dir;
    std::string master = dir.write("auto.master", "/misc nis:auto.misc\n");
    TraceCapture capture;
    AutomounterConfigParser parser(master);
    parser.parse();
    bool atMin = false;
    for (const QvLogWrapper::Message& m : capture.messages()) {
        if (m.text == "Map type 'nis' not supported.") atMin = m.level == QvLogWrapper::LEVEL_MIN;
    }
    EXPECT_TRUE(atMin) << capture.dump();
}

TEST(AutomounterConfigParser, RelativeMapNameIsLookedUpBesideTheMasterFile) {
    TempDir dir;
    dir.write("sub/auto.data", "data server:/export/data\n");
    std::string master = dir.write("sub/auto.master", "/misc auto.data\n");
    TraceCapture capture;
    AutomounterConfigParser parser(master);
    EXPECT_EQ(parseCatching(parser), "");
    EXPECT_EQ(parser.getRemoteMountPoints(), (Strings{"/misc/data"}));
    EXPECT_TRUE(capture.contains("mapPath='" + dir.file("sub/auto.data") + "'")) << capture.dump();
}

TEST(AutomounterConfigParser, FurtherTokensOfAMasterLineAreOptionsAndIgnored) {
    TempDir dir;
    std::string map = dir.write("auto.misc", "cd :/dev/cdrom\n");
    std::string master = dir.write("auto.master", "/misc\t" + map + "\t--timeout=60 --ghost\n");
    AutomounterConfigParser parser(master);
    EXPECT_EQ(parseCatching(parser), "");
    EXPECT_EQ(parser.getLocalMountPoints(), (Strings{"/misc/cd"}));
}

TEST(AutomounterConfigParser, HostsMapIsFileTypeAndItsFailureIsOnlyTraced) {
    TempDir dir;
    std::string map = dir.write("auto.misc", "data server:/export/data\n");
    std::string master = dir.write("auto.master", "/net -hosts\n/misc " + map + "\n");
    TraceCapture capture;
    AutomounterConfigParser parser(master);
    EXPECT_EQ(parseCatching(parser), "");
    EXPECT_TRUE(capture.contains("mapType='file', mapPath='-hosts', mapFormat='', mountPoint='/net'"))
        << capture.dump();
    EXPECT_TRUE(capture.contains("Map parsing failed: Unable to open automounter map file: -hosts")) << capture.dump();
    EXPECT_EQ(parser.getRemoteMountPoints(), (Strings{"/misc/data"}));
}

TEST(AutomounterConfigParser, MissingMapIsTracedAndNextEntryIsRead) {
    TempDir dir;
    std::string missing = dir.file("auto.none");
    std::string map = dir.write("auto.misc", "cd :/dev/cdrom\n");
    std::string master = dir.write("auto.master", "/none " + missing + "\n/misc " + map + "\n");
    TraceCapture capture;
    AutomounterConfigParser parser(master);
    EXPECT_EQ(parseCatching(parser), "");
    EXPECT_TRUE(capture.contains("Map parsing failed: Unable to open automounter map file: " + missing))
        << capture.dump();
    EXPECT_EQ(parser.getLocalMountPoints(), (Strings{"/misc/cd"}));
}

TEST(AutomounterConfigParser, MalformedMapSkipsOnlyTheRestOfThatMap) {
    TempDir dir;
    std::string bad = dir.write("auto.bad",
                                "first server:/export/first\n"
                                "lonely\n"
                                "after server:/export/after\n");
    std::string good = dir.write("auto.good", "cd :/dev/cdrom\n");
    std::string master = dir.write("auto.master", "/bad " + bad + "\n/good " + good + "\n");
    TraceCapture capture;
    AutomounterConfigParser parser(master);
    EXPECT_EQ(parseCatching(parser), "");
    EXPECT_TRUE(capture.contains("Map parsing failed: Unknown map file format")) << capture.dump();
    EXPECT_EQ(parser.getRemoteMountPoints(), (Strings{"/bad/first"}));
    EXPECT_EQ(parser.getLocalMountPoints(), (Strings{"/good/cd"}));
}

// ---- one map -------------------------------------------------------------------

TEST(PlainFileParser, MissingMapThrows) {
    TempDir dir;
    std::string path = dir.file("nothing");
    PlainFileParser parser("file", path, "", "/misc");
    Strings remote, local;
    try {
        parser.parse(remote, local);
        FAIL() << "no exception";
    } catch (const std::string& failure) {
        EXPECT_EQ(failure, "Unable to open automounter map file: " + path);
    }
}

TEST(PlainFileParser, CdromEntryIsLocalUnderMountPoint) {
    TempDir dir;
    std::string path = dir.write("map", "cd -fstype=iso9660 :/dev/cdrom\n");
    PlainFileParser parser("file", path, "", "/misc");
    Strings remote, local;
    parser.parse(remote, local);
    EXPECT_EQ(local, (Strings{"/misc/cd"}));
    EXPECT_TRUE(remote.empty());
}

TEST(PlainFileParser, HostPathEntryIsRemote) {
    TempDir dir;
    std::string path = dir.write("map", "data server:/export/data\n");
    PlainFileParser parser("file", path, "", "/misc");
    Strings remote, local;
    parser.parse(remote, local);
    EXPECT_EQ(remote, (Strings{"/misc/data"}));
    EXPECT_TRUE(local.empty());
}

TEST(PlainFileParser, WildcardKeyStandsForDirectoryAbove) {
    TempDir dir;
    std::string path = dir.write("map",
                                 "* server:/export/&\n"
                                 "a*b server:/export/ab\n"
                                 "/abs/x*/y :/dev/sdb1\n");
    PlainFileParser parser("file", path, "", "/misc");
    Strings remote, local;
    parser.parse(remote, local);
    EXPECT_EQ(remote, (Strings{"/misc", "/misc"}));
    EXPECT_EQ(local, (Strings{"/abs"}));
}

TEST(PlainFileParser, AbsoluteKeyIsTheMountDirectory) {
    TempDir dir;
    std::string path = dir.write("map", "/direct/share\t-rw\tnas:/vol/share\n");
    PlainFileParser parser("file", path, "", "/-");
    Strings remote, local;
    parser.parse(remote, local);
    EXPECT_EQ(remote, (Strings{"/direct/share"}));
}

TEST(PlainFileParser, TrailingBackslashIsDroppedAndNextLineIsNotJoined) {
    TempDir dir;
    // Without the removal the location would be "\", which is local.
    std::string path = dir.write("map",
                                 "data -rw server:/export/data \\\n"
                                 "other :/dev/sdc1\n");
    PlainFileParser parser("file", path, "", "/misc");
    Strings remote, local;
    parser.parse(remote, local);
    EXPECT_EQ(remote, (Strings{"/misc/data"}));
    EXPECT_EQ(local, (Strings{"/misc/other"}));
}

TEST(PlainFileParser, ContinuedLocationOnItsOwnLineMakesTheMapFail) {
    TempDir dir;
    std::string path = dir.write("map",
                                 "data -rw \\\n"
                                 "\tserver:/export/data\n");
    PlainFileParser parser("file", path, "", "/misc");
    Strings remote, local;
    std::string failure;
    try {
        parser.parse(remote, local);
    } catch (const std::string& f) {
        failure = f;
    }
    EXPECT_EQ(failure, "Unknown map file format");
    // The first line was judged alone, by its options token.
    EXPECT_EQ(local, (Strings{"/misc/data"}));
    EXPECT_TRUE(remote.empty());
}

TEST(PlainFileParser, SingleTokenLineThrowsAfterEarlierEntriesAreSorted) {
    TempDir dir;
    std::string path = dir.write("map", "a server:/a\nb\nc server:/c\n");
    PlainFileParser parser("file", path, "", "/m");
    Strings remote, local;
    std::string failure;
    try {
        parser.parse(remote, local);
    } catch (const std::string& f) {
        failure = f;
    }
    EXPECT_EQ(failure, "Unknown map file format");
    EXPECT_EQ(remote, (Strings{"/m/a"}));
}

TEST(PlainFileParser, IsRemoteJudgesTheLastToken) {
    EXPECT_TRUE(PlainFileParser::isRemote(Strings{"data", "server:/export/data"}));
    EXPECT_TRUE(PlainFileParser::isRemote(Strings{"web", "://server/share"}));
    EXPECT_TRUE(PlainFileParser::isRemote(Strings{"x", "server:/a", "-rw", "host:"}));
    EXPECT_FALSE(PlainFileParser::isRemote(Strings{"cd", "-fstype=iso9660", ":/dev/sda1"}));
    EXPECT_FALSE(PlainFileParser::isRemote(Strings{"local", "/srv/local"}));
    EXPECT_FALSE(PlainFileParser::isRemote(Strings{"x", "server:/a", "-rw"}));
    EXPECT_FALSE(PlainFileParser::isRemote(Strings{"x", ":/"}));
}

TEST(PlainFileParser, UsableThroughTheDelegateInterface) {
    TempDir dir;
    std::string path = dir.write("map", "data server:/export/data\n");
    ParserDelegate* delegate = new PlainFileParser("file", path, "", "/misc");
    Strings remote, local;
    delegate->parse(remote, local);
    delete delegate;
    EXPECT_EQ(remote, (Strings{"/misc/data"}));
}

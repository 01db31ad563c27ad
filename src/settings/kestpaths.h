#pragma once

#include <QString>

// The system's fixed paths, with the test-root prefix applied.
class KestPaths
{
public:
    static QString root();
    static QString settingsFile();
    static QString workDir();
    static QString groupsFile();
    static QString specialsFile();
    static QString dbusPidFile();
    static QString cachePidFile();
    static QString homeRoot();
    static QString machineIdFile();
    static QString accountMapFile();
};

#include "kestpaths.h"

#include "paths.h"

namespace
{
QString prefixed(const char *path)
{
    return QString::fromLocal8Bit(kest_root()) + QString::fromLatin1(path);
}
} // namespace

QString KestPaths::root()
{
    return QString::fromLocal8Bit(kest_root());
}

QString KestPaths::settingsFile()
{
    return prefixed(KEST_PATH_SETTINGS);
}

QString KestPaths::workDir()
{
    return prefixed(KEST_PATH_WORKDIR);
}

QString KestPaths::groupsFile()
{
    return workDir() + QStringLiteral("/groups.txt");
}

QString KestPaths::specialsFile()
{
    return workDir() + QStringLiteral("/specials.txt");
}

QString KestPaths::dbusPidFile()
{
    return prefixed(KEST_PATH_DBUS_PID);
}

QString KestPaths::cachePidFile()
{
    return prefixed(KEST_PATH_CACHE_PID);
}

QString KestPaths::homeRoot()
{
    return prefixed(KEST_PATH_HOME);
}

QString KestPaths::machineIdFile()
{
    return prefixed(KEST_PATH_MACHINE_ID);
}

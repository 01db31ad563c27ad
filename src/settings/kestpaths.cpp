#include "kestpaths.h"

#include "paths.h"

#include <QByteArray>
#include <QHash>

namespace
{
// Paths are asked for at every request; only tests ever change the root, so each joined path is kept
// for the root text it was made with.
QString prefixed(const char *path)
{
    struct Joined {
        QByteArray root;
        QString path;
    };
    thread_local QHash<const char *, Joined> joined;
    const char *root = kest_root();
    Joined &entry = joined[path];
    if (entry.path.isNull() || entry.root != root)
        entry = { root, QString::fromLocal8Bit(root) + QString::fromLatin1(path) };
    return entry.path;
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

QString KestPaths::accountMapFile()
{
    return prefixed(KEST_PATH_ACCOUNT_MAP);
}

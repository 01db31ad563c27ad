#include "settingsfile.h"

#include "kestpaths.h"

#include <QFile>
#include <QHash>
#include <QSettings>

#include <mutex>

#include <sys/stat.h>

namespace
{
struct Version {
    QString path;
    bool exists = false;
    dev_t device = 0;
    ino_t inode = 0;
    off_t size = 0;
    timespec modified {};
    timespec changed {};

    bool operator==(const Version &other) const
    {
        return path == other.path && exists == other.exists && device == other.device && inode == other.inode
            && size == other.size && modified.tv_sec == other.modified.tv_sec
            && modified.tv_nsec == other.modified.tv_nsec && changed.tv_sec == other.changed.tv_sec
            && changed.tv_nsec == other.changed.tv_nsec;
    }
};

Version versionOf(const QString &path)
{
    Version version;
    version.path = path;
    struct stat info;
    if (stat(QFile::encodeName(path).constData(), &info) != 0)
        return version;
    version.exists = true;
    version.device = info.st_dev;
    version.inode = info.st_ino;
    version.size = info.st_size;
    version.modified = info.st_mtim;
    version.changed = info.st_ctim;
    return version;
}

struct Cache {
    std::mutex mutex;
    Version version;
    bool loaded = false;
    QHash<QString, QVariant> values;
};

Cache &cache()
{
    static Cache instance;
    return instance;
}
} // namespace

QVariant SettingsFile::value(const QString &group, const QString &key, const QVariant &defaultValue)
{
    Cache &settings = cache();
    const Version now = versionOf(KestPaths::settingsFile());
    std::lock_guard<std::mutex> lock(settings.mutex);
    if (!settings.loaded || !(now == settings.version)) {
        settings.values.clear();
        const QSettings file(now.path, QSettings::IniFormat);
        const QStringList keys = file.allKeys();
        for (const QString &name : keys)
            settings.values.insert(name, file.value(name));
        settings.version = now;
        settings.loaded = true;
    }
    return settings.values.value(group + QLatin1Char('/') + key, defaultValue);
}

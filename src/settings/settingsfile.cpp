#include "settingsfile.h"

#include "fileversion.h"
#include "kestpaths.h"

#include <QDebug>
#include <QHash>
#include <QSet>
#include <QSettings>

#include <mutex>

namespace
{
struct Cache {
    std::mutex mutex;
    QString path;
    FileVersion version;
    bool loaded = false;
    bool settled = false; // the file had settled when it was parsed: an unchanged version means unchanged values
    QHash<QString, QVariant> values;
    // What was already told about the version in hand.
    QString warnedPath;
    FileVersion warnedVersion;
    QSet<QString> warned;
};

Cache &cache()
{
    static Cache instance;
    return instance;
}

thread_local int oneLookDepth = 0;
thread_local bool lookedOnce = false;

// Under the cache's lock.
void refresh(Cache &settings)
{
    if (settings.loaded && oneLookDepth > 0 && lookedOnce)
        return;
    const QString path = KestPaths::settingsFile();
    const FileVersion now = FileVersion::of(path);
    lookedOnce = oneLookDepth > 0;
    if (settings.loaded && settings.settled && now == settings.version && path == settings.path)
        return;
    settings.values.clear();
    const QSettings file(path, QSettings::IniFormat);
    const QStringList keys = file.allKeys();
    for (const QString &name : keys)
        settings.values.insert(name, file.value(name));
    settings.path = path;
    settings.version = now;
    settings.settled = now.isSettled();
    settings.loaded = true;
}
} // namespace

QVariant SettingsFile::value(const QString &group, const QString &key, const QVariant &defaultValue)
{
    Cache &settings = cache();
    std::lock_guard<std::mutex> lock(settings.mutex);
    refresh(settings);
    return settings.values.value(group + QLatin1Char('/') + key, defaultValue);
}

bool SettingsFile::exists()
{
    Cache &settings = cache();
    std::lock_guard<std::mutex> lock(settings.mutex);
    refresh(settings);
    return settings.version.exists();
}

SettingsFile::OneLook::OneLook()
{
    if (oneLookDepth++ == 0)
        lookedOnce = false;
}

SettingsFile::OneLook::~OneLook()
{
    --oneLookDepth;
}

void SettingsFile::warnOncePerVersion(const QString &text)
{
    {
        Cache &settings = cache();
        std::lock_guard<std::mutex> lock(settings.mutex);
        refresh(settings);
        if (!(settings.warnedVersion == settings.version) || settings.warnedPath != settings.path) {
            settings.warnedVersion = settings.version;
            settings.warnedPath = settings.path;
            settings.warned.clear();
        }
        if (settings.warned.contains(text))
            return;
        settings.warned.insert(text);
    }
    qWarning().noquote() << text;
}

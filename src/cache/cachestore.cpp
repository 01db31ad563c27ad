#include "cachestore.h"

#include "fileversion.h"
#include "kestpaths.h"

#include <QDebug>
#include <QDir>
#include <QDirIterator>
#include <QFile>
#include <QFileInfo>
#include <QHash>
#include <QRegularExpression>

#include <mutex>

#include <cerrno>
#include <unistd.h>

namespace
{
constexpr int kFirstDomainUid = 10000;

QString workDir()
{
    return KestPaths::workDir();
}

bool workDirExists()
{
    return QFileInfo(workDir()).isDir();
}

QFileInfoList regularFiles()
{
    return QDir(workDir()).entryInfoList(QDir::Files | QDir::NoSymLinks | QDir::NoDotAndDotDot, QDir::Unsorted);
}

// Records read for answers, kept while their files stay the same: a look-up or login of a cached
// account then costs one stat instead of reading and checking the file again.
struct ReadRecords {
    struct Entry {
        FileVersion version;
        CacheControlPtr record;
    };
    std::mutex mutex;
    QHash<quint32, Entry> entries;
};
constexpr int kReadRecordsKept = 256;

ReadRecords &readRecords()
{
    static ReadRecords instance;
    return instance;
}

CacheControlPtr recordHolding(quint32 uid, const QString &account)
{
    const CacheControlPtr record = readCacheRecord(uid);
    return record && record->account() == account ? record : CacheControlPtr();
}

bool isDomainUserFileName(const QString &name)
{
    bool isNumber = false;
    const int uid = name.toInt(&isNumber, 10);
    return isNumber && uid >= kFirstDomainUid;
}

void cleanDomainUserFile(const QString &path)
{
    if (::chown(QFile::encodeName(path).constData(), 0, 0) != 0) {
        const int error = errno;
        qWarning().noquote() << QStringLiteral("cannot change file owner, ") + path + QStringLiteral(", error:")
                + qt_error_string(error);
    }
    if (!QFile::remove(path))
        qWarning().noquote() << QStringLiteral("cannot remove domain user cache file, ") + path;
}
} // namespace

QString cacheFilePath(const CacheControlInterface &record)
{
    return cacheFilePathOfUid(record.uid());
}

QString cacheFilePathOfUid(quint32 uid)
{
    return workDir() + QLatin1Char('/') + QString::number(uid);
}

bool cacheFileExists(const CacheControlInterface &record)
{
    return QFile::exists(cacheFilePath(record));
}

bool saveCacheRecord(CacheControlInterface &record)
{
    return record.writeToFile(cacheFilePath(record));
}

bool loadCacheRecord(CacheControlPtr &record)
{
    if (!record)
        return false;
    // One open serves both the version and the fields.
    QFile file(cacheFilePath(*record));
    const quint32 fileVersion = file.open(QIODevice::ReadOnly) ? cacheVersionOfDevice(file) : 0;
    if (fileVersion != record->version()) {
        const quint32 uid = record->uid();
        record = createCacheControl(fileVersion);
        if (!record)
            return false;
        record->setUid(uid);
    }
    return record->readFromDevice(file);
}

CacheControlPtr readCacheRecord(quint32 uid)
{
    const QString path = cacheFilePathOfUid(uid);
    // Not followed: the listing skips links, so a link must not answer here either.
    const FileVersion version = FileVersion::of(path, false);
    if (!version.isRegularFile())
        return CacheControlPtr();
    const bool settled = version.isSettled();
    ReadRecords &kept = readRecords();
    {
        std::lock_guard<std::mutex> lock(kept.mutex);
        const auto entry = kept.entries.constFind(uid);
        if (entry != kept.entries.cend() && entry->version == version)
            return entry->record;
    }
    CacheControlPtr record = createCacheControl();
    record->setUid(uid);
    if (!loadCacheRecord(record) || !record)
        return CacheControlPtr();
    if (!settled)
        return record;
    std::lock_guard<std::mutex> lock(kept.mutex);
    // One out for one in: a walk over the whole store must not flush the records in use.
    if (kept.entries.size() >= kReadRecordsKept && !kept.entries.contains(uid))
        kept.entries.erase(kept.entries.begin());
    kept.entries.insert(uid, { version, record });
    return record;
}

bool cacheRecordFromJson(CacheControlPtr &record, const QString &json)
{
    const quint32 jsonVersion = cacheVersionOfJson(json);
    if (!record || jsonVersion != record->version()) {
        record = createCacheControl(jsonVersion);
        if (!record) {
            qWarning().noquote() << QStringLiteral("invalid cache control version.");
            return false;
        }
    }
    return record->fromJsonString(json);
}

quint32 uidOfCacheFilePath(const QString &path)
{
    bool isNumber = false;
    const quint32 uid = path.mid(path.lastIndexOf(QLatin1Char('/')) + 1).toUInt(&isNumber, 10);
    return isNumber ? uid : 0;
}

QStringList listCacheFiles()
{
    QStringList paths;
    if (!workDirExists())
        return paths;
    static const QRegularExpression recordName(QStringLiteral("/\\d+$"));
    // Walked, not listed: a large store never holds the file information of every record at once.
    QDirIterator entries(workDir(), QDir::Files | QDir::NoSymLinks | QDir::NoDotAndDotDot);
    while (entries.hasNext()) {
        entries.next();
        const QString path = entries.fileInfo().absoluteFilePath();
        if (recordName.match(path).hasMatch())
            paths.append(path);
    }
    return paths;
}

QList<quint32> listCacheUids()
{
    QList<quint32> uids;
    const QString prefix = workDir() + QLatin1Char('/');
    const QStringList paths = listCacheFiles();
    for (const QString &path : paths) {
        bool isNumber = false;
        const quint32 uid = path.startsWith(prefix) ? path.mid(prefix.size()).toUInt(&isNumber, 10) : 0;
        if (!isNumber) {
            qWarning().noquote() << QStringLiteral("cache file path error !!!");
            continue;
        }
        uids.append(uid);
    }
    return uids;
}

bool findCacheUidByAccount(const QString &account, quint32 &uid, quint32 knownUid, CacheControlPtr *found)
{
    uid = 0;
    CacheControlPtr record = knownUid != 0 ? recordHolding(knownUid, account) : nullptr;
    if (record)
        uid = knownUid;
    const QStringList paths = record ? QStringList() : listCacheFiles();
    for (const QString &path : paths) {
        const quint32 candidate = uidOfCacheFilePath(path);
        if (!path.endsWith(QString::number(candidate)) || !(record = recordHolding(candidate, account)))
            continue;
        uid = candidate;
        break;
    }
    if (found)
        *found = record;
    return record != nullptr;
}

void removeCacheFile(quint32 uid)
{
    const QString path = cacheFilePathOfUid(uid);
    if (QFile::exists(path))
        QFile::remove(path);
}

void removeAllCacheFiles()
{
    const QStringList paths = listCacheFiles();
    for (const QString &path : paths) {
        if (QFile::exists(path))
            removeCacheFile(uidOfCacheFilePath(path));
    }
}

void cleanDomainUserCacheFiles()
{
    if (!workDirExists()) {
        qWarning().noquote() << QStringLiteral("service working directory is not exists.");
        return;
    }
    const QFileInfoList entries = regularFiles();
    for (const QFileInfo &entry : entries) {
        const QString path = entry.absoluteFilePath();
        if (!isDomainUserFileName(entry.fileName())) {
            qInfo().noquote() << QStringLiteral("not domain user cache file: ") + path;
            continue;
        }
        cleanDomainUserFile(path);
    }
}

bool refreshCacheRecord(quint32 uid)
{
    CacheControlPtr record = createCacheControl();
    record->setUid(uid);
    if (!loadCacheRecord(record))
        return false;
    return saveCacheRecord(*record);
}

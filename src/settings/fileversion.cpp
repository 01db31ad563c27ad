#include "fileversion.h"

#include <QFile>

#include <sys/stat.h>

FileVersion FileVersion::of(const QString &path, bool followLinks)
{
    FileVersion version;
    struct stat info;
    const QByteArray name = QFile::encodeName(path);
    if ((followLinks ? stat(name.constData(), &info) : lstat(name.constData(), &info)) != 0)
        return version;
    version.m_exists = true;
    version.m_regular = S_ISREG(info.st_mode);
    version.m_device = info.st_dev;
    version.m_inode = info.st_ino;
    version.m_size = info.st_size;
    version.m_modified = info.st_mtim;
    version.m_changed = info.st_ctim;
    return version;
}

bool FileVersion::isSettled() const
{
    const auto nanoseconds = [](const timespec &time) { return qint64(time.tv_sec) * 1000000000 + time.tv_nsec; };
    // Well above a clock tick; time stamps without fractions may come from a file system that counts whole
    // seconds, where the same second is the same tick.
    const bool wholeSeconds = m_modified.tv_nsec == 0 && m_changed.tv_nsec == 0;
    const qint64 window = (wholeSeconds ? 1100 : 100) * qint64(1000000);
    timespec now {};
    clock_gettime(CLOCK_REALTIME, &now);
    return nanoseconds(now) - qMax(nanoseconds(m_modified), nanoseconds(m_changed)) >= window;
}

bool FileVersion::operator==(const FileVersion &other) const
{
    return m_exists == other.m_exists && m_regular == other.m_regular && m_device == other.m_device
        && m_inode == other.m_inode && m_size == other.m_size && m_modified.tv_sec == other.m_modified.tv_sec
        && m_modified.tv_nsec == other.m_modified.tv_nsec && m_changed.tv_sec == other.m_changed.tv_sec
        && m_changed.tv_nsec == other.m_changed.tv_nsec;
}

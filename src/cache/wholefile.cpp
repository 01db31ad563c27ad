#include "wholefile.h"

#include <QDebug>
#include <QDir>
#include <QFile>
#include <QFileInfo>

#include <cerrno>
#include <cstring>
#include <fcntl.h>
#include <sys/stat.h>
#include <unistd.h>

namespace
{
const QString kScratchSuffix = QStringLiteral(".kest-new-");

// Qt keeps the owner's bits four bits higher than the group's, which it keeps as the mode does.
mode_t modeOf(QFileDevice::Permissions permissions)
{
    const uint bits = uint(permissions);
    return mode_t(((bits & 0x7000) >> 6) | ((bits & 0x70) >> 1) | (bits & 0x7));
}

// Only a regular file that is not a link counts: a link at the name is to be replaced.
bool holdsAlready(const QByteArray &path, const QByteArray &content, mode_t mode)
{
    const int fd = ::open(path.constData(), O_RDONLY | O_NOFOLLOW | O_CLOEXEC);
    if (fd < 0)
        return false;
    struct stat status;
    bool same = ::fstat(fd, &status) == 0 && S_ISREG(status.st_mode) && (status.st_mode & 07777) == mode
        && status.st_size == content.size();
    QByteArray held(content.size() + 1, Qt::Uninitialized);
    qint64 total = 0;
    while (same && total < held.size()) {
        const ssize_t got = ::read(fd, held.data() + total, size_t(held.size() - total));
        if (got < 0 && errno == EINTR)
            continue;
        if (got <= 0)
            break;
        total += got;
    }
    ::close(fd);
    return same && total == content.size() && std::memcmp(held.constData(), content.constData(), size_t(total)) == 0;
}

bool writeAll(int fd, const QByteArray &content)
{
    qint64 written = 0;
    while (written < content.size()) {
        const ssize_t done = ::write(fd, content.constData() + written, size_t(content.size() - written));
        if (done < 0 && errno == EINTR)
            continue;
        if (done <= 0) {
            if (done == 0)
                errno = ENOSPC;
            return false;
        }
        written += done;
    }
    return true;
}

bool syncDirectory(const QByteArray &directory)
{
    const int fd = ::open(directory.constData(), O_RDONLY | O_DIRECTORY | O_CLOEXEC);
    if (fd < 0)
        return false;
    const bool synced = ::fsync(fd) == 0;
    const int error = errno;
    ::close(fd);
    errno = error;
    return synced;
}

// The new file is created owner-only and gets its mode before any content, so a file meant for the
// owner alone is never readable by others, not even while it is written.
bool replace(
    const QByteArray &path, const QByteArray &directory, QByteArray &scratch, const QByteArray &content, mode_t mode)
{
    const int fd = ::mkostemp(scratch.data(), O_CLOEXEC);
    if (fd < 0) {
        scratch.clear();
        return false;
    }
    const bool written = ::fchmod(fd, mode) == 0 && writeAll(fd, content) && ::fsync(fd) == 0;
    const int error = errno;
    const bool closed = ::close(fd) == 0;
    if (!written)
        errno = error;
    if (!written || !closed)
        return false;
    if (::rename(scratch.constData(), path.constData()) != 0)
        return false;
    scratch.clear();
    return syncDirectory(directory);
}
} // namespace

bool WholeFile::write(
    const QString &path, const QByteArray &content, QFileDevice::Permissions permissions, QString &error)
{
    const QByteArray encoded = QFile::encodeName(path);
    const mode_t mode = modeOf(permissions);
    if (holdsAlready(encoded, content, mode))
        return true;
    const QFileInfo info(path);
    const QByteArray directory = QFile::encodeName(info.path());
    QByteArray scratch = QFile::encodeName(info.path() + QLatin1Char('/') + info.fileName() + kScratchSuffix)
        + QByteArrayLiteral("XXXXXX");
    if (replace(encoded, directory, scratch, content, mode))
        return true;
    const int failure = errno;
    if (!scratch.isEmpty())
        ::unlink(scratch.constData());
    error = QString::fromLocal8Bit(std::strerror(failure));
    qWarning().noquote() << QStringLiteral("cannot replace file ") + path + QStringLiteral(": ") + error;
    return false;
}

bool WholeFile::isScratchName(const QString &fileName)
{
    const int at = fileName.lastIndexOf(kScratchSuffix);
    return at > 0 && fileName.size() == at + kScratchSuffix.size() + 6;
}

void WholeFile::removeScratchFiles(const QString &directory)
{
    const QStringList names = QDir(directory).entryList(QDir::Files | QDir::System | QDir::Hidden);
    for (const QString &name : names) {
        if (isScratchName(name))
            QFile::remove(directory + QLatin1Char('/') + name);
    }
}

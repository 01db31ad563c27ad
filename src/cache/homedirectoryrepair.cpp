#include "homedirectoryrepair.h"

#include "kestpaths.h"
#include "userlistmanager.h"

#include <QDebug>
#include <QDir>
#include <QDirIterator>
#include <QFileInfo>
#include <QSet>
#include <QStringList>

#include <cerrno>
#include <cstring>
#include <sys/stat.h>
#include <unistd.h>

namespace
{
const gid_t homeGroup = 10000;
// These numbers are hexadecimal on purpose and go to chmod as they stand.
const mode_t directoryMode = 0x750;
const mode_t fileMode = 0x640;

QString systemError()
{
    return QString::fromLocal8Bit(strerror(errno));
}
} // namespace

void HomeDirectoryRepair::repair(const QString &userName, const UserListManager &users)
{
    const QString home = KestPaths::homeRoot() + QLatin1Char('/') + userName;
    if (userName.isEmpty() || !QFileInfo::exists(home)) {
        qWarning().noquote() << QStringLiteral("user home directory is not exists.");
        return;
    }
    const uint uid = users.uidOfName(userName);
    if (uid == 0) {
        qWarning().noquote() << QStringLiteral("cannot find user id: ") + userName;
        return;
    }
    const QString absolute = QFileInfo(home).absoluteFilePath();
    const QByteArray encoded = QFile::encodeName(absolute);
    struct stat info;
    if (stat(encoded.constData(), &info) == 0 && info.st_uid == uid) {
        qInfo().noquote() << QStringLiteral("directory ") + absolute + QStringLiteral(" owner ") + userName
                + QStringLiteral(" is already right.");
        return;
    }
    const bool owned = chown(encoded.constData(), uid, homeGroup) == 0;
    const bool moded = chmod(encoded.constData(), directoryMode) == 0;
    if (!owned && !moded) {
        qWarning().noquote() << QStringLiteral("cannot update directory permissions. error: ") + systemError();
        return;
    }
    walk(absolute, uid, userName);
}

void HomeDirectoryRepair::walk(const QString &home, uint uid, const QString &userName)
{
    QStringList pending { home };
    QSet<QString> walked;
    int directories = 0;
    int files = 0;
    while (!pending.isEmpty()) {
        const QString directory = pending.takeFirst();
        // Every directory entry puts its parent back on the list; walking a path once keeps this finite.
        if (walked.contains(directory))
            continue;
        walked.insert(directory);
        // The iterator keeps the file system's own order; QDir would sort by name even when told not to.
        QDirIterator entries(directory, QDir::Dirs | QDir::Files | QDir::NoDotAndDotDot);
        while (entries.hasNext()) {
            entries.next();
            const QFileInfo entry = entries.fileInfo();
            const QString parent = entry.absolutePath();
            const QByteArray encoded = QFile::encodeName(parent);
            if (chown(encoded.constData(), uid, homeGroup) != 0)
                qWarning().noquote() << QStringLiteral("cannot update directory permissions. error: ") + systemError();
            if (entry.isDir()) {
                pending.append(parent);
                chmod(encoded.constData(), directoryMode);
                ++directories;
            } else {
                chmod(encoded.constData(), fileMode);
                ++files;
            }
        }
    }
    qInfo().noquote() << "changed user: " << userName << " home " << directories << " directories and " << files
                      << " files";
}

#include "wholefile.h"

#include <QFile>

bool WholeFile::write(
    const QString &path, const QByteArray &content, QFileDevice::Permissions permissions, QString &error)
{
    QFile file(path);
    const QFileDevice::Permissions modeBits = QFileDevice::ReadOwner | QFileDevice::WriteOwner | QFileDevice::ExeOwner
        | QFileDevice::ReadGroup | QFileDevice::WriteGroup | QFileDevice::ExeGroup | QFileDevice::ReadOther
        | QFileDevice::WriteOther | QFileDevice::ExeOther;
    if (file.open(QIODevice::ReadOnly) && file.size() == content.size() && file.readAll() == content
        && (file.permissions() & modeBits) == permissions)
        return true;
    file.close();
    if (!file.open(QIODevice::WriteOnly | QIODevice::Truncate)) {
        error = file.errorString();
        return false;
    }
    // A full disk must not pass for a written file.
    file.setPermissions(permissions);
    if (file.write(content) != content.size() || !file.flush()) {
        error = file.errorString();
        return false;
    }
    return true;
}

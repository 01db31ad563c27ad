#include "wholefile.h"

#include <QFile>

bool WholeFile::write(
    const QString &path, const QByteArray &content, QFileDevice::Permissions permissions, QString &error)
{
    QFile file(path);
    if (file.open(QIODevice::ReadOnly) && file.size() == content.size() && file.readAll() == content
        && file.permissions() == permissions)
        return true;
    file.close();
    if (!file.open(QIODevice::WriteOnly | QIODevice::Truncate)) {
        error = file.errorString();
        return false;
    }
    file.setPermissions(permissions);
    file.write(content);
    return true;
}

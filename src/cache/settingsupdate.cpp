#include "settingsupdate.h"

#include "kestpaths.h"
#include "wholefile.h"

#include <QDebug>
#include <QFile>
#include <QFileInfo>
#include <QSettings>
#include <QTemporaryDir>

namespace
{
const QFileDevice::Permissions kReadableByAll
    = QFileDevice::ReadOwner | QFileDevice::WriteOwner | QFileDevice::ReadGroup | QFileDevice::ReadOther;

QByteArray currentContent(const QString &path)
{
    QFile file(path);
    return file.open(QIODevice::ReadOnly) ? file.readAll() : QByteArray();
}
} // namespace

bool SettingsUpdate::apply(const std::function<void(QSettings &)> &change)
{
    const QString path = KestPaths::settingsFile();
    const QTemporaryDir scratchDir;
    const QString scratch = scratchDir.filePath(QStringLiteral("kest-iam.conf"));
    QFile copy(scratch);
    if (!scratchDir.isValid() || !copy.open(QIODevice::WriteOnly) || copy.write(currentContent(path)) < 0
        || !copy.flush()) {
        qWarning().noquote() << QStringLiteral("cannot change settings file ") + path
                + QStringLiteral(": no scratch copy");
        return false;
    }
    copy.close();
    {
        QSettings settings(scratch, QSettings::IniFormat);
        change(settings);
        settings.sync();
        if (settings.status() != QSettings::NoError) {
            qWarning().noquote() << QStringLiteral("cannot change settings file ") + path
                    + QStringLiteral(": scratch copy not written");
            return false;
        }
    }
    const QFileInfo current(path);
    const QFileDevice::Permissions permissions = current.exists() ? current.permissions() & 0x7077 : kReadableByAll;
    QString error;
    return WholeFile::write(path, currentContent(scratch), permissions, error);
}

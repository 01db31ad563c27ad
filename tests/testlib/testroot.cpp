#include "testroot.h"

#include <QDateTime>
#include <QDir>
#include <QFileInfo>

namespace
{
const char rootVariable[] = "KEST_IAM_ROOT";
} // namespace

TestRoot::TestRoot()
    : m_previousRoot(qgetenv(rootVariable))
    , m_hadPreviousRoot(qEnvironmentVariableIsSet(rootVariable))
{
    if (!m_dir.isValid())
        return;
    for (const char *directory : { "/etc", "/var/lib/libkest-iam", "/run", "/home", "/usr/share/kest" })
        QDir().mkpath(filePath(QString::fromLatin1(directory)));
    qputenv(rootVariable, QFile::encodeName(m_dir.path()));
}

TestRoot::~TestRoot()
{
    m_hadPreviousRoot ? qputenv(rootVariable, m_previousRoot) : qunsetenv(rootVariable);
}

bool TestRoot::writeFile(const QString &systemPath, const QByteArray &content) const
{
    const QString target = filePath(systemPath);
    QDir().mkpath(QFileInfo(target).absolutePath());
    QFile file(target);
    if (!file.open(QIODevice::WriteOnly | QIODevice::Truncate) || file.write(content) != content.size()
        || !file.flush())
        return false;
    // QSettings keeps a parsed copy while size and time stamp stay the same; rewrites within one
    // millisecond must still be seen, so every write gets a time stamp of its own.
    static qint64 sequence = 0;
    return file.setFileTime(QDateTime::currentDateTime().addSecs(++sequence), QFileDevice::FileModificationTime);
}

QByteArray TestRoot::readFile(const QString &systemPath) const
{
    QFile file(filePath(systemPath));
    return file.open(QIODevice::ReadOnly) ? file.readAll() : QByteArray();
}

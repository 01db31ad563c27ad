#include "testroot.h"

#include <QDateTime>
#include <QDir>
#include <QFile>
#include <QFileInfo>

namespace {
const char rootVariable[] = "KEST_IAM_ROOT";
const char *const systemDirectories[] = { "/etc", "/var/lib/libkest-iam", "/run", "/home", "/usr/share/kest" };
} // namespace

TestRoot::TestRoot()
    : m_previousRoot(qgetenv(rootVariable))
    , m_hadPreviousRoot(qEnvironmentVariableIsSet(rootVariable))
{
    if (!m_dir.isValid())
        return;
    for (const char *directory : systemDirectories)
        QDir().mkpath(filePath(QString::fromLatin1(directory)));
    qputenv(rootVariable, QFile::encodeName(m_dir.path()));
}

TestRoot::~TestRoot()
{
    if (m_hadPreviousRoot)
        qputenv(rootVariable, m_previousRoot);
    else
        qunsetenv(rootVariable);
}

bool TestRoot::isValid() const
{
    return m_dir.isValid();
}

QString TestRoot::path() const
{
    return m_dir.path();
}

QString TestRoot::filePath(const QString &systemPath) const
{
    return m_dir.path() + systemPath;
}

QString TestRoot::workDir() const
{
    return filePath(QStringLiteral("/var/lib/libkest-iam"));
}

bool TestRoot::writeFile(const QString &systemPath, const QByteArray &content) const
{
    const QString target = filePath(systemPath);
    QDir().mkpath(QFileInfo(target).absolutePath());
    QFile file(target);
    if (!file.open(QIODevice::WriteOnly | QIODevice::Truncate))
        return false;
    if (file.write(content) != content.size() || !file.flush())
        return false;
    // QSettings keeps a parsed copy while size and time stamp stay the same; rewrites within one
    // millisecond must still be seen, so every write gets a time stamp of its own.
    static qint64 sequence = 0;
    return file.setFileTime(QDateTime::currentDateTime().addSecs(++sequence), QFileDevice::FileModificationTime);
}

QByteArray TestRoot::readFile(const QString &systemPath) const
{
    QFile file(filePath(systemPath));
    if (!file.open(QIODevice::ReadOnly))
        return QByteArray();
    return file.readAll();
}

bool TestRoot::writeSettings(const QByteArray &ini) const
{
    return writeFile(QStringLiteral("/etc/kest-iam.conf"), ini);
}

bool TestRoot::removeSettings() const
{
    return QFile::remove(filePath(QStringLiteral("/etc/kest-iam.conf")));
}

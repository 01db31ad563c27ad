#include "fuzzroot.h"

#include <QDir>
#include <QFile>
#include <QTemporaryDir>

#include <cstdlib>

namespace
{
void quiet(QtMsgType, const QMessageLogContext &, const QString &) { }
} // namespace

const FuzzRoot &FuzzRoot::instance()
{
    static const FuzzRoot root;
    return root;
}

FuzzRoot::FuzzRoot()
{
    static QTemporaryDir directory;
    m_path = directory.path();
    QDir().mkpath(m_path + QStringLiteral("/var/lib/libkest-iam"));
    QDir().mkpath(m_path + QStringLiteral("/etc"));
    QDir().mkpath(m_path + QStringLiteral("/run"));
    setenv("KEST_IAM_ROOT", QFile::encodeName(m_path).constData(), 1);
    qInstallMessageHandler(quiet);
}

bool FuzzRoot::writeFile(const QString &systemPath, const uint8_t *data, size_t size) const
{
    QFile file(path(systemPath));
    return file.open(QIODevice::WriteOnly | QIODevice::Truncate)
        && file.write(reinterpret_cast<const char *>(data), qint64(size)) == qint64(size);
}

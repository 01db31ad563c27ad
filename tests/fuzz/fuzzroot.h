#pragma once

#include <QDir>
#include <QFile>
#include <QTemporaryDir>

#include <cstdint>
#include <cstdlib>

// Set-up shared by the fuzz targets: a private system root (KEST_IAM_ROOT) with the service's
// directories, and a message handler that drops the log so that runs stay fast.
class FuzzRoot
{
public:
    static const FuzzRoot &instance()
    {
        static const FuzzRoot root;
        return root;
    }
    QString path(const QString &systemPath) const { return m_dir.path() + systemPath; }
    bool writeFile(const QString &systemPath, const QByteArray &bytes) const
    {
        QFile file(path(systemPath));
        return file.open(QIODevice::WriteOnly | QIODevice::Truncate) && file.write(bytes) == bytes.size();
    }

private:
    FuzzRoot()
    {
        for (const char *directory : { "/var/lib/libkest-iam", "/etc", "/run" })
            QDir().mkpath(path(QLatin1String(directory)));
        setenv("KEST_IAM_ROOT", QFile::encodeName(m_dir.path()).constData(), 1);
        qInstallMessageHandler([](QtMsgType, const QMessageLogContext &, const QString &) {});
    }
    QTemporaryDir m_dir;
};

// The fuzzer's input, not copied.
inline QByteArray fuzzInput(const uint8_t *data, size_t size)
{
    return QByteArray::fromRawData(reinterpret_cast<const char *>(data), int(size));
}

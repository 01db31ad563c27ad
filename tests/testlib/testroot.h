#pragma once

#include <QByteArray>
#include <QFile>
#include <QString>
#include <QTemporaryDir>

// A temporary system root: the directories the system uses, exported as KEST_IAM_ROOT while it lives.
class TestRoot
{
public:
    TestRoot();
    ~TestRoot();
    TestRoot(const TestRoot &) = delete;
    TestRoot &operator=(const TestRoot &) = delete;

    bool isValid() const { return m_dir.isValid(); }
    // Absolute path of a system path ("/etc/kest-iam.conf") inside this root.
    QString filePath(const QString &systemPath) const { return m_dir.path() + systemPath; }
    QString workDir() const { return filePath(QStringLiteral("/var/lib/libkest-iam")); }

    bool writeFile(const QString &systemPath, const QByteArray &content) const;
    QByteArray readFile(const QString &systemPath) const;
    bool writeSettings(const QByteArray &ini) const { return writeFile(QStringLiteral("/etc/kest-iam.conf"), ini); }
    bool removeSettings() const { return QFile::remove(filePath(QStringLiteral("/etc/kest-iam.conf"))); }

private:
    QTemporaryDir m_dir;
    QByteArray m_previousRoot;
    bool m_hadPreviousRoot;
};

#pragma once

#include <QByteArray>
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

    bool isValid() const;
    QString path() const;
    // Absolute path of a system path ("/etc/kest-iam.conf") inside this root.
    QString filePath(const QString &systemPath) const;
    QString workDir() const;

    bool writeFile(const QString &systemPath, const QByteArray &content) const;
    QByteArray readFile(const QString &systemPath) const;
    bool writeSettings(const QByteArray &ini) const;
    bool removeSettings() const;

private:
    QTemporaryDir m_dir;
    QByteArray m_previousRoot;
    bool m_hadPreviousRoot;
};

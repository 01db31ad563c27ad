#pragma once

#include <QString>

#include <cstddef>
#include <cstdint>

// Set-up shared by the fuzz targets: a private system root (KEST_IAM_ROOT) with the service's
// directories, and a message handler that drops the log so that runs stay fast.
class FuzzRoot
{
public:
    static const FuzzRoot &instance();
    QString path(const QString &systemPath) const { return m_path + systemPath; }
    bool writeFile(const QString &systemPath, const uint8_t *data, size_t size) const;

private:
    FuzzRoot();
    QString m_path;
};

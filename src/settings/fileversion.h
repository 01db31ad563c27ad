#pragma once

#include <QString>

#include <sys/types.h>
#include <time.h>

// What one stat tells of a file: enough to see that it was edited, replaced or removed since the last look.
class FileVersion
{
public:
    // Without followLinks a symbolic link is looked at itself, not at what it names.
    static FileVersion of(const QString &path, bool followLinks = true);

    bool exists() const { return m_exists; }
    bool isRegularFile() const { return m_regular; }
    // Whether a later change is sure to show in the time stamps. One made within the same tick of the file
    // system's clock would not, so what was read of a file changed that recently must not be kept.
    bool isSettled() const;
    bool operator==(const FileVersion &other) const;

private:
    bool m_exists = false;
    bool m_regular = false;
    dev_t m_device = 0;
    ino_t m_inode = 0;
    off_t m_size = 0;
    timespec m_modified {};
    timespec m_changed {};
};

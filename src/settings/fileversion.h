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
    // A file changed this recently may change again within the same time stamp, unseen by a comparison.
    bool isRecent(int milliseconds) const;
    bool operator==(const FileVersion &other) const;
    bool operator!=(const FileVersion &other) const { return !(*this == other); }

private:
    bool m_exists = false;
    bool m_regular = false;
    dev_t m_device = 0;
    ino_t m_inode = 0;
    off_t m_size = 0;
    timespec m_modified {};
    timespec m_changed {};
};

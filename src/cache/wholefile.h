#pragma once

#include <QByteArray>
#include <QFileDevice>
#include <QString>

// Files that are replaced whole: the content goes to a new file beside the old one, reaches the disk,
// and is renamed over the name, so that a reader or a crash sees the old file or the new one, never
// a part. A rewrite that would leave the same bytes is skipped: every look-up refreshes the account
// files, and almost always with what they already hold.
class WholeFile
{
public:
    // False with the system's error text (also logged, with the path) when the file could not be
    // replaced; the old file is then left as it was. A link at the name is replaced, not followed.
    static bool write(
        const QString &path, const QByteArray &content, QFileDevice::Permissions permissions, QString &error);
    // Whether a name is one of the new files that write() makes (left behind by a crash).
    static bool isScratchName(const QString &fileName);
    // Removes the new files a crash left behind in a folder.
    static void removeScratchFiles(const QString &directory);
};

#pragma once

#include <QByteArray>
#include <QFileDevice>
#include <QString>

// Files that are rewritten whole. A rewrite that would leave the same bytes is skipped: every look-up
// refreshes the account files, and almost always with what they already hold.
class WholeFile
{
public:
    // False with the file's error text when it cannot be written.
    static bool write(
        const QString &path, const QByteArray &content, QFileDevice::Permissions permissions, QString &error);
};

#pragma once

#include <QByteArray>

// A shell command run with the built modules under libnss-wrapper (or libpam-wrapper for pamtester), so
// that the machine's own passwd, group and PAM files are never read. The wrapped passwd, group and PAM
// service files are in one folder.
class WrappedCommand
{
public:
    static QByteArray modulePath(const char *name);
    // The exit status, a space and everything the command printed.
    static QByteArray run(const QByteArray &filesFolder, const QByteArray &command);
};

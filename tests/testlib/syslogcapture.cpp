#include "syslogcapture.h"

#include <QMutex>
#include <QMutexLocker>

#include <cstdarg>
#include <cstdio>

namespace
{
QMutex mutex;
QList<SyslogLine> captured;
} // namespace

// Fortified builds call the checking variants (__syslog_chk, __vsyslog_chk).
extern "C" {
void vsyslog(int priority, const char *format, va_list args)
{
    char text[65536];
    vsnprintf(text, sizeof(text), format, args);
    QMutexLocker locker(&mutex);
    captured.append(SyslogLine { priority, QByteArray(text) });
}

void __vsyslog_chk(int priority, int, const char *format, va_list args)
{
    vsyslog(priority, format, args);
}

void syslog(int priority, const char *format, ...)
{
    va_list args;
    va_start(args, format);
    vsyslog(priority, format, args);
    va_end(args);
}

void __syslog_chk(int priority, int, const char *format, ...)
{
    va_list args;
    va_start(args, format);
    vsyslog(priority, format, args);
    va_end(args);
}
}

void SyslogCapture::clear()
{
    QMutexLocker locker(&mutex);
    captured.clear();
}

QList<SyslogLine> SyslogCapture::lines()
{
    QMutexLocker locker(&mutex);
    return captured;
}

QList<SyslogLine> SyslogCapture::matching(const QByteArray &fragment)
{
    QList<SyslogLine> result;
    for (const SyslogLine &line : lines()) {
        if (line.text.contains(fragment))
            result.append(line);
    }
    return result;
}

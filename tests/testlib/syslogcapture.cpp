#include "syslogcapture.h"

#include <QMutex>
#include <QMutexLocker>

#include <cstdarg>
#include <cstdio>

namespace {
QMutex mutex;
QList<SyslogLine> captured;

void record(int priority, const char *format, va_list args)
{
    char text[65536];
    vsnprintf(text, sizeof(text), format, args);
    QMutexLocker locker(&mutex);
    captured.append(SyslogLine { priority, QByteArray(text) });
}
} // namespace

extern "C" {
void syslog(int priority, const char *format, ...)
{
    va_list args;
    va_start(args, format);
    record(priority, format, args);
    va_end(args);
}

void vsyslog(int priority, const char *format, va_list args)
{
    record(priority, format, args);
}

// Fortified builds call the checking variants.
void __syslog_chk(int priority, int, const char *format, ...)
{
    va_list args;
    va_start(args, format);
    record(priority, format, args);
    va_end(args);
}

void __vsyslog_chk(int priority, int, const char *format, va_list args)
{
    record(priority, format, args);
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
    const QList<SyslogLine> all = lines();
    for (const SyslogLine &line : all) {
        if (line.text.contains(fragment))
            result.append(line);
    }
    return result;
}

int SyslogCapture::count(const QByteArray &fragment)
{
    return matching(fragment).size();
}

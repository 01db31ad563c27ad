#include "messagehandler.h"

#include "heldloglines.h"

#include <QString>

#include <ctime>
#include <syslog.h>

int syslogPriorityOf(QtMsgType type)
{
    switch (type) {
    case QtDebugMsg:
        return LOG_DEBUG;
    case QtWarningMsg:
        return LOG_WARNING;
    case QtCriticalMsg:
        return LOG_CRIT;
    case QtFatalMsg:
        return LOG_ERR;
    case QtInfoMsg:
        return LOG_INFO;
    }
    return LOG_NOTICE;
}

void writeLogLine(QtMsgType type, unsigned long ticks, const QString &message)
{
    QString text = QStringLiteral("cpu time: ") + QString::number(ticks) + QStringLiteral(", ") + message;
    text.replace(QStringLiteral("\\\""), QString());
    text.replace(QStringLiteral("\\n"), QStringLiteral(" "));
    text.replace(QLatin1Char('\n'), QStringLiteral(". "));
    text.replace(QLatin1Char('\r'), QStringLiteral(". "));
    // The text goes through "%s": a "%" in a message must never be read as a conversion.
    syslog(syslogPriorityOf(type), "%s", text.toUtf8().constData());
}

void messageHandler(QtMsgType type, const QMessageLogContext &context, const QString &message)
{
    Q_UNUSED(context)
    const unsigned long ticks = static_cast<unsigned long>(clock());
    // A fatal message ends the process: it and everything before it go out now.
    if (type == QtFatalMsg)
        HeldLogLines::flush();
    else if (HeldLogLines::hold(type, ticks, message))
        return;
    writeLogLine(type, ticks, message);
}

#include "statusprinter.h"

#include <QDateTime>
#include <QJsonArray>

namespace
{
// In the machine's local time, as the rest of its logs.
QString localTime(const QJsonValue &value)
{
    if (!value.isString())
        return QStringLiteral("never");
    const QDateTime time = QDateTime::fromString(value.toString(), Qt::ISODate);
    return time.isValid() ? time.toLocalTime().toString(QStringLiteral("yyyy-MM-dd HH:mm:ss")) : value.toString();
}

QString line(const char *label, const QString &value)
{
    return QString::fromLatin1(label).leftJustified(20) + value + QLatin1Char('\n');
}

QString offlineText(const QJsonObject &verdict)
{
    if (verdict.value(QLatin1String("allowed")).toBool())
        return QStringLiteral("allowed until ") + localTime(verdict.value(QLatin1String("until")));
    const QString reason = verdict.value(QLatin1String("reason")).toString();
    if (reason == QLatin1String("expired"))
        return QStringLiteral("refused: expired on ") + localTime(verdict.value(QLatin1String("until")));
    if (verdict.contains(QLatin1String("lockedUntil")) && reason == QLatin1String("locked after failed attempts"))
        return QStringLiteral("refused: locked after failed attempts until ")
            + localTime(verdict.value(QLatin1String("lockedUntil")));
    return QStringLiteral("refused: ") + reason;
}
} // namespace

int StatusPrinter::exitStatus(const QJsonObject &status)
{
    if (!status.value(QLatin1String("enabled")).toBool())
        return 2;
    return status.value(QLatin1String("state")).toString() == QLatin1String("online") ? 0 : 1;
}

QString StatusPrinter::text(const QJsonObject &status)
{
    const QJsonObject server = status.value(QLatin1String("server")).toObject();
    QString state = status.value(QLatin1String("state")).toString() + QStringLiteral(" since ")
        + localTime(status.value(QLatin1String("since")));
    if (status.contains(QLatin1String("reason")))
        state += QStringLiteral(" (") + status.value(QLatin1String("reason")).toString() + QLatin1Char(')');
    QString out = line("enabled:",
                      status.value(QLatin1String("enabled")).toBool() ? QStringLiteral("yes") : QStringLiteral("no"))
        + line("server:",
            server.value(QLatin1String("address")).toString() + QLatin1Char(':')
                + QString::number(server.value(QLatin1String("port")).toInt()))
        + line("state:", state) + line("last contact:", localTime(status.value(QLatin1String("lastContact"))))
        + line("last refresh:", localTime(status.value(QLatin1String("lastRefresh"))))
        + line("cached accounts:", QString::number(status.value(QLatin1String("cachedAccounts")).toInt()));
    const QJsonArray accounts = status.value(QLatin1String("accounts")).toArray();
    for (const QJsonValue &value : accounts) {
        const QJsonObject account = value.toObject();
        out += QLatin1Char('\n')
            + line("account:",
                account.value(QLatin1String("name")).toString() + QStringLiteral(" (uid ")
                    + QString::number(qint64(account.value(QLatin1String("uid")).toDouble())) + QLatin1Char(')'))
            + line("  last online login:", localTime(account.value(QLatin1String("lastOnlineLogin"))))
            + line("  offline login:", offlineText(account.value(QLatin1String("offlineLogin")).toObject()))
            + line("  home:", account.value(QLatin1String("home")).toString());
    }
    return out;
}

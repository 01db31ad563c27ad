#include "serverreachability.h"

#include <QDebug>

void ServerReachability::markUnreachable(const QString &hostPort, const QString &detail)
{
    if (m_unreachable.exchange(true))
        return;
    qWarning().noquote() << QStringLiteral("error host address: ") + hostPort + QStringLiteral(", error detail: ")
            + detail;
}

#include "serverreachability.h"

#include <QDateTime>
#include <QDebug>

namespace
{
qint64 now()
{
    return QDateTime::currentSecsSinceEpoch();
}
} // namespace

void ServerReachability::markUnreachable(const QString &hostPort, const QString &detail)
{
    {
        std::lock_guard<std::mutex> lock(m_mutex);
        if (!m_state.known || !m_state.unreachable)
            m_state.since = now();
        m_state.known = true;
        m_state.unreachable = true;
        m_state.detail = detail;
    }
    if (m_unreachable.exchange(true))
        return;
    qWarning().noquote() << QStringLiteral("error host address: ") + hostPort + QStringLiteral(", error detail: ")
            + detail;
}

void ServerReachability::markReachable()
{
    {
        std::lock_guard<std::mutex> lock(m_mutex);
        if (!m_state.known || m_state.unreachable)
            m_state.since = now();
        m_state.known = true;
        m_state.unreachable = false;
        m_state.detail.clear();
        m_state.lastContact = now();
    }
    m_unreachable.store(false);
}

void ServerReachability::noteContact()
{
    std::lock_guard<std::mutex> lock(m_mutex);
    m_state.lastContact = now();
    if (!m_state.known) {
        m_state.known = true;
        m_state.since = m_state.lastContact;
    }
}

ServerReachability::Snapshot ServerReachability::snapshot() const
{
    std::lock_guard<std::mutex> lock(m_mutex);
    return m_state;
}

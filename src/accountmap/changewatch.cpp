#include "changewatch.h"

#include <QDebug>
#include <QFile>
#include <QSocketNotifier>

#include <cerrno>
#include <cstring>
#include <sys/inotify.h>
#include <unistd.h>

namespace
{
// A record written in place ends with a close, a replaced one with a rename onto its name; the front
// service's removals and an ownership change show as well.
const uint32_t watchedEvents
    = IN_CLOSE_WRITE | IN_MOVED_TO | IN_MOVED_FROM | IN_CREATE | IN_DELETE | IN_ATTRIB | IN_DELETE_SELF | IN_MOVE_SELF;
} // namespace

ChangeWatch::ChangeWatch(QObject *parent)
    : QObject(parent)
    , m_fd(inotify_init1(IN_NONBLOCK | IN_CLOEXEC))
{
    m_changes.everything = true;
    if (m_fd < 0) {
        qWarning().noquote() << QStringLiteral("cannot watch for file changes: ") + qt_error_string(errno);
        return;
    }
    m_notifier = new QSocketNotifier(m_fd, QSocketNotifier::Read, this);
    connect(m_notifier, &QSocketNotifier::activated, this, &ChangeWatch::readEvents);
}

ChangeWatch::~ChangeWatch()
{
    if (m_fd >= 0)
        close(m_fd);
}

void ChangeWatch::watch(const QString &directory, const QString &name)
{
    m_watched.append({ directory, QFile::encodeName(name), -1 });
    watchMissing();
}

void ChangeWatch::watchMissing()
{
    for (Watched &watched : m_watched) {
        if (watched.descriptor >= 0)
            continue;
        // Unwatched, nothing that happens there is told: whoever asks looks at it all.
        m_changes.everything = true;
        if (m_fd >= 0)
            watched.descriptor
                = inotify_add_watch(m_fd, QFile::encodeName(watched.directory).constData(), watchedEvents | IN_ONLYDIR);
    }
}

void ChangeWatch::poll()
{
    if (m_fd >= 0)
        readQueued();
}

ChangeWatch::Changes ChangeWatch::take()
{
    Changes changes;
    std::swap(changes, m_changes);
    for (const Watched &watched : qAsConst(m_watched))
        m_changes.everything = m_changes.everything || watched.descriptor < 0;
    return changes;
}

void ChangeWatch::readEvents()
{
    if (readQueued())
        Q_EMIT changed();
}

// True when an event concerned a watched entry.
bool ChangeWatch::readQueued()
{
    alignas(inotify_event) char buffer[16384];
    bool relevant = false;
    ssize_t length;
    while ((length = read(m_fd, buffer, sizeof(buffer))) > 0) {
        for (ssize_t at = 0; at < length;) {
            const auto *event = reinterpret_cast<const inotify_event *>(buffer + at);
            at += ssize_t(sizeof(inotify_event) + event->len);
            if (event->mask & IN_Q_OVERFLOW) {
                m_changes.everything = true;
                relevant = true;
            }
            for (Watched &watched : m_watched) {
                if (watched.descriptor != event->wd)
                    continue;
                // The directory itself went away: watched again once it is back.
                if (event->mask & (IN_IGNORED | IN_DELETE_SELF | IN_MOVE_SELF)) {
                    if (event->mask & IN_MOVE_SELF)
                        inotify_rm_watch(m_fd, event->wd);
                    watched.descriptor = -1;
                    m_changes.everything = true;
                    relevant = true;
                } else if (event->len > 0 && (watched.name.isEmpty() || watched.name == event->name)) {
                    m_changes.paths.insert(watched.directory + QLatin1Char('/') + QFile::decodeName(event->name));
                    relevant = true;
                }
            }
        }
    }
    return relevant;
}

#pragma once

#include <QObject>
#include <QSet>
#include <QString>
#include <QStringList>

class QSocketNotifier;

// Tells of files written, replaced, renamed or removed in some directories, through inotify: what other
// processes (the front service, an administrator's editor) do to the files the daemon publishes from.
class ChangeWatch : public QObject
{
    Q_OBJECT

public:
    // What changed since the last take().
    struct Changes {
        // Events were lost (the queue overflowed) or a watched directory went, came back or cannot be
        // watched: anything may have changed.
        bool everything = false;
        // directory + "/" + name of each entry named by an event.
        QSet<QString> paths;
        bool isEmpty() const { return !everything && paths.isEmpty(); }
    };

    explicit ChangeWatch(QObject *parent = nullptr);
    ~ChangeWatch() override;

    // Every entry of directory, or only the one named name when name is not empty. A directory that does
    // not exist yet is watched from the first call of watchMissing() that finds it.
    void watch(const QString &directory, const QString &name = QString());
    void watchMissing();
    // Reads the events queued so far, without waiting for the event loop: a change this process has just
    // made itself is among them.
    void poll();
    Changes take();

Q_SIGNALS:
    void changed();

private:
    struct Watched {
        QString directory;
        QByteArray name;
        int descriptor = -1;
    };
    void readEvents();
    bool readQueued();

    int m_fd = -1;
    QSocketNotifier *m_notifier = nullptr;
    QList<Watched> m_watched;
    Changes m_changes;
};

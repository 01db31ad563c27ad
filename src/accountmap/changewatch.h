#pragma once

#include <QObject>
#include <QString>
#include <QStringList>

class QSocketNotifier;

// Tells of files written, replaced, renamed or removed in some directories, through inotify: what other
// processes (the front service, an administrator's editor) do to the files the daemon publishes from.
class ChangeWatch : public QObject
{
    Q_OBJECT

public:
    explicit ChangeWatch(QObject *parent = nullptr);
    ~ChangeWatch() override;

    // Every entry of directory, or only the one named name when name is not empty. A directory that does
    // not exist yet is watched from the first call of watchMissing() that finds it.
    void watch(const QString &directory, const QString &name = QString());
    void watchMissing();

Q_SIGNALS:
    void changed();

private:
    struct Watched {
        QString directory;
        QByteArray name;
        int descriptor = -1;
    };
    void readEvents();

    int m_fd = -1;
    QSocketNotifier *m_notifier = nullptr;
    QList<Watched> m_watched;
};

#pragma once

#include <QByteArray>
#include <QHostAddress>
#include <QObject>

class QSocketNotifier;
class QTimer;

// One client of the request server, on the descriptor accepted for it: buffered reads, writes finished in
// the background, the peer's leaving. A QTcpSocket per connection cost more than the look-up it served.
class LocalConnection : public QObject
{
    Q_OBJECT

public:
    // Takes the descriptor; it is closed when the connection ends or is destroyed.
    explicit LocalConnection(int descriptor, QObject *parent = nullptr);
    ~LocalConnection() override;

    qint64 bytesAvailable() const { return m_input.size(); }
    QByteArray peek(int length) const { return m_input.left(length); }
    QByteArray read(int length);
    // Sends what the socket takes now and the rest as it drains.
    void write(const QByteArray &bytes);
    // Closes once everything written has been sent.
    void disconnectFromHost();
    void abort();

    // True once the peer has closed its end, even while its last bytes are still unread.
    bool peerHasLeft() const;
    QString errorString() const { return m_error; }
    // Aborts after the time-out while unread bytes are kept, stops watching when nothing is.
    void watchPendingBytes(int timeoutMs);

    // Null, and port left as it was, when the descriptor is gone.
    QHostAddress peerAddress(quint16 &port) const;
    QHostAddress localAddress(quint16 &port) const;

    // Takes what has arrived; the read notifications call it again for what follows.
    void receive();

Q_SIGNALS:
    void readyRead();
    void disconnected();

private:
    void sendPending();
    void end(const QString &reason);
    void closeDescriptor();

    int m_descriptor;
    QSocketNotifier *m_readable = nullptr;
    QSocketNotifier *m_writable = nullptr;
    QTimer *m_pendingTimer = nullptr;
    QByteArray m_input;
    QByteArray m_output;
    bool m_closeWhenSent = false;
    QString m_error;
};

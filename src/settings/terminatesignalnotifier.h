#pragma once

#include <QObject>

#include <initializer_list>

// Turns terminating signals into a Qt signal on the event loop. The handler itself only writes the
// signal number to a pipe: anything more inside it can deadlock against a lock the interrupted code holds.
class TerminateSignalNotifier : public QObject
{
    Q_OBJECT

public:
    // Every request is made, even for signals the system refuses to let a handler catch.
    TerminateSignalNotifier(std::initializer_list<int> signalNumbers, QObject *parent = nullptr);
    bool isValid() const;

Q_SIGNALS:
    void received(int signalNumber);

private:
    bool m_valid = false;
};

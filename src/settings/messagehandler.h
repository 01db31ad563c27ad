#pragma once

#include <QtGlobal>

class QMessageLogContext;
class QString;

// Routes every Qt message to the system log, prefixed with the process's processor time.
void messageHandler(QtMsgType type, const QMessageLogContext &context, const QString &message);

// One line as the handler writes it, for a message at the given processor time.
void writeLogLine(QtMsgType type, unsigned long ticks, const QString &message);

// Syslog priority of a Qt message type (critical and fatal cross on purpose).
int syslogPriorityOf(QtMsgType type);

#include "domainserverfixture.h"
#include "httphelper.h"
#include "kestpaths.h"
#include "messagehandler.h"
#include "settingscheck.h"
#include "settingswatch.h"
#include "syslogcapture.h"
#include "testroot.h"

#include <QTest>

namespace
{
// Line by line, so that a row can name the line it breaks: an enabled client of a server at a literal address.
const QStringList cleanLines { QStringLiteral("[main]"), QStringLiteral("enable=true"), QStringLiteral("ip=127.0.0.2"),
    QStringLiteral("port=10080"), QStringLiteral("[url]"), QStringLiteral("server-cert=C/ca.pem"),
    QStringLiteral("public-key=C/client.pem"), QStringLiteral("private-key=C/client.key"),
    QStringLiteral("[offline_login]"), QStringLiteral("enable=true"), QStringLiteral("cache_validity=1") };
} // namespace

// The configuration check against files broken one way each, and the daemon's watch that tells each finding once
// per version of the file.
class SettingsCheckTest : public QObject
{
    Q_OBJECT
    TestRoot m_root;
    QTemporaryDir m_certificates;

    // C stands for the certificate directory.
    QString withCertificates(QString text) const
    {
        return text.replace(QStringLiteral("C/"), m_certificates.path() + QLatin1Char('/'));
    }

private Q_SLOTS:
    void initTestCase()
    {
        qInstallMessageHandler(messageHandler);
        QVERIFY(DomainServerFixture::makeCertificates(m_certificates.path()));
    }

    void brokenFiles_data()
    {
        // edits: "N:text" replaces line N, "+text" adds a line at the end; "-" removes the file.
        QTest::addColumn<QStringList>("edits");
        QTest::addColumn<QStringList>("findings"); // the beginning of each finding, after the path
        QTest::addColumn<int>("status");
        const auto row = [](const char *name, const QStringList &edits, const QStringList &findings, int status) {
            QTest::newRow(name) << edits << findings << status;
        };
        row("clean", {}, {}, 0);
        row("a key another helper reads", { QStringLiteral("4:negative-cache-timeout=15") }, {}, 0);
        row("no file", { QStringLiteral("-") },
            { QStringLiteral(": error: the settings file is missing: every setting takes its default") }, 2);
        for (const char *port : { "10o80", "0", "65536", "" })
            QTest::addRow("port %s", port) << QStringList { QStringLiteral("4:port=") + QLatin1String(port) }
                                           << QStringList { QStringLiteral(":4: error: [main] port: \"%1\" is not a "
                                                                           "whole number in 1-65535")
                                                                .arg(QLatin1String(port)) }
                                           << 2;
        row("enable not a boolean", { QStringLiteral("2:enable=yes") },
            { QStringLiteral(":2: error: [main] enable: \"yes\" is not a boolean (true or false)") }, 2);
        row("negative validity", { QStringLiteral("11:cache_validity=-1") },
            { QStringLiteral(":11: error: [offline_login] cache_validity: \"-1\" is not a whole number in 0-49710") },
            2);
        row("failed-login limit not a number", { QStringLiteral("4:max-failed-logins=three") },
            { QStringLiteral(":4: error: [main] max-failed-logins: \"three\" is not a whole number of at least 0") },
            2);
        row("misspelt key", { QStringLiteral("10:enabel=true") },
            { QStringLiteral(":10: warning: [offline_login] enabel: unknown key, ignored (nearest known: "
                             "[offline_login] enable)") },
            1);
        row("key in the wrong group", { QStringLiteral("3:sever-cert=C/ca.pem") },
            { QStringLiteral(
                ":3: warning: [main] sever-cert: unknown key, ignored (nearest known: [url] server-cert)") },
            1);
        row("unknown group", { QStringLiteral("+[mian]"), QStringLiteral("+port=1") },
            { QStringLiteral(":12: warning: [mian]: unknown group, ignored (nearest known: [main])") }, 1);
        row("not a key=value line", { QStringLiteral("+garbage") },
            { QStringLiteral(":12: warning: [offline_login]: not a key=value line, ignored: garbage") }, 1);
        row("CA file missing", { QStringLiteral("6:server-cert=C/missing.pem") },
            { withCertificates(QStringLiteral(":6: error: [url] server-cert: C/missing.pem: missing")) }, 2);
        row("CA file a directory", { QStringLiteral("6:server-cert=C/") },
            { withCertificates(QStringLiteral(":6: error: [url] server-cert: C/: not a file")) }, 2);
        row("CA file holds a key", { QStringLiteral("6:server-cert=C/ca.key") },
            { withCertificates(QStringLiteral(":6: error: [url] server-cert: C/ca.key: holds no PEM certificate")) },
            2);
        row("CA not set", { QStringLiteral("6:server-cert=") },
            { QStringLiteral(":6: warning: [url] server-cert: not set, while the service is switched on") }, 1);
        row("client certificate expired",
            { QStringLiteral("7:public-key=C/expired.pem"), QStringLiteral("8:private-key=C/expired.key") },
            { QStringLiteral(":7: error: [url] public-key: certificate \"kest-test-domain-server\" expired on 20") },
            2);
        row("client key is a certificate", { QStringLiteral("8:private-key=C/client.pem") },
            { withCertificates(
                QStringLiteral(":8: error: [url] private-key: C/client.pem: holds no PEM RSA private key")) },
            2);
        row("client key of another certificate", { QStringLiteral("8:private-key=C/server.key") },
            { QStringLiteral(":8: error: [url] private-key: the key does not belong to the certificate of [url] "
                             "public-key (line 7)") },
            2);
    }

    void brokenFiles()
    {
        QFETCH(QStringList, edits);
        QFETCH(QStringList, findings);
        QStringList lines = cleanLines;
        for (const QString &edit : qAsConst(edits)) {
            if (edit.startsWith(QLatin1Char('+')))
                lines.append(edit.mid(1));
            else if (edit != QLatin1String("-"))
                lines[edit.section(QLatin1Char(':'), 0, 0).toInt() - 1] = edit.section(QLatin1Char(':'), 1);
        }
        QVERIFY(m_root.writeSettings(withCertificates(lines.join(QLatin1Char('\n'))).toUtf8()));
        if (edits.contains(QStringLiteral("-")))
            QVERIFY(m_root.removeSettings());
        const QString path = KestPaths::settingsFile();
        const QList<SettingsFinding> found = SettingsCheck::check(path);
        QStringList texts;
        for (const SettingsFinding &finding : found)
            texts << finding.text(path).mid(path.size());
        QCOMPARE(texts.size(), findings.size());
        for (int i = 0; i < texts.size(); ++i)
            QVERIFY2(texts.at(i).startsWith(findings.at(i)), qPrintable(texts.at(i)));
        QTEST(SettingsCheck::exitStatus(found), "status");
    }

    // The daemon looks once a second, yet tells a finding once per version of the file; so does the probe that
    // finds no file at all.
    void findingsToldOncePerVersion()
    {
        SyslogCapture::clear();
        QVERIFY(m_root.writeSettings("[main]\nenabel=true\n"));
        SettingsWatch watch(KestPaths::settingsFile(), false);
        watch.start();
        QTest::qWait(5000);
        QCOMPARE(SyslogCapture::count("[main] enabel: unknown key"), 1);
        QVERIFY(m_root.writeSettings("[main]\nenabel=true\nport=x\n"));
        QTRY_COMPARE_WITH_TIMEOUT(SyslogCapture::count("[main] port:"), 1, 3000);
        QCOMPARE(SyslogCapture::count("[main] enabel: unknown key"), 2);

        QVERIFY(m_root.removeSettings());
        QTRY_COMPARE_WITH_TIMEOUT(SyslogCapture::count("the settings file is missing"), 1, 3000);
        HttpHelper helper;
        QString hostPort;
        for (int i = 0; i < 5; ++i)
            QVERIFY(!helper.checkServerAddress(hostPort));
        QTest::qWait(2000);
        QCOMPARE(SyslogCapture::count("configuration file is broken."), 1);
        QCOMPARE(SyslogCapture::count(KestPaths::settingsFile().toUtf8() + ": error: the settings file is missing"), 1);
    }
};

QTEST_GUILESS_MAIN(SettingsCheckTest)
#include "test_settingscheck.moc"

// Runs a fuzz target once over every file of the directories and files given: the corpus as a
// regression test, in builds without libFuzzer.
#include <QDirIterator>
#include <QFile>

#include <cstdint>
#include <cstdio>

extern "C" int LLVMFuzzerTestOneInput(const uint8_t *data, size_t size);

int main(int argc, char *argv[])
{
    QStringList inputs;
    for (int i = 1; i < argc; ++i) {
        const QString path = QFile::decodeName(argv[i]);
        QDirIterator files(path, QDir::Files);
        if (!files.hasNext())
            inputs << path; // a file, or a directory that is empty and so fails below
        while (files.hasNext())
            inputs << files.next();
    }
    for (const QString &path : qAsConst(inputs)) {
        QFile file(path);
        if (!file.open(QIODevice::ReadOnly)) {
            std::fprintf(stderr, "cannot read %s\n", qPrintable(path));
            return 1;
        }
        const QByteArray bytes = file.readAll();
        LLVMFuzzerTestOneInput(reinterpret_cast<const uint8_t *>(bytes.constData()), size_t(bytes.size()));
    }
    std::printf("%d inputs replayed\n", int(inputs.size()));
    return inputs.isEmpty() ? 1 : 0;
}

// Runs a fuzz target once over every file of its corpus: the regular test suite keeps what the
// fuzzer found (and the real answers it started from) passing, without a fuzzing compiler.
#include <QDir>
#include <QFile>
#include <gtest/gtest.h>

extern "C" int LLVMFuzzerTestOneInput(const uint8_t* data, size_t size);

// One suite name per target (CorpusReplay_<target>), so that each replay has a test name of its own.
#ifndef FUZZ_REPLAY_SUITE
#define FUZZ_REPLAY_SUITE CorpusReplay
#endif

TEST(FUZZ_REPLAY_SUITE, EveryCorpusInputRunsClean)
{
    const QDir corpus(QStringLiteral(FUZZ_CORPUS_DIR));
    const QStringList files = corpus.entryList(QDir::Files);
    ASSERT_FALSE(files.isEmpty()) << FUZZ_CORPUS_DIR;
    for (const QString& name : files) {
        QFile file(corpus.filePath(name));
        ASSERT_TRUE(file.open(QIODevice::ReadOnly)) << qPrintable(name);
        const QByteArray input = file.readAll();
        SCOPED_TRACE(qPrintable(name));
        EXPECT_EQ(
            LLVMFuzzerTestOneInput(reinterpret_cast<const uint8_t*>(input.constData()), size_t(input.size())),
            0);
    }
}

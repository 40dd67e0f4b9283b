// delvix-host seed: fills the store of a data folder with synthetic camera answers, for
// benchmarks and demonstrations at scale.
#include "HostCommand.h"

#include "Tamsa.h"
#include "TamsaSeeder.h"

#include <QDir>
#include <QDirIterator>
#include <QElapsedTimer>
#include <cstdio>

namespace {

qint64 folderBytes(const QString& path)
{
    qint64 total = 0;
    QDirIterator it(path, QDir::Files | QDir::Hidden, QDirIterator::Subdirectories);
    while (it.hasNext()) {
        it.next();
        total += it.fileInfo().size();
    }
    return total;
}

} // namespace

int runSeed(const HostOptions& options)
{
    if (!options.positional.isEmpty()) {
        std::fprintf(stderr, "delvix-host seed: unexpected argument %s\n",
                     qUtf8Printable(options.positional.first()));
        return 2;
    }
    if (options.locations == 0) {
        std::fprintf(stderr, "delvix-host seed: --locations must be at least 1\n");
        return 2;
    }
    // The plug-in finds its store at INSTALL_PATH + "Server", and INSTALL_PATH is the data folder.
    const QString storage = QDir(options.dataDir).absoluteFilePath(QStringLiteral("Server"));
    unsigned char initRecord[704] = {0xC0, 0x02};
    void* database = nullptr;
    int32_t status = Tamsa_InitDatabase(&database, initRecord, 0);
    if (status == TAMSA_OK) {
        status = Tamsa_SetStoragesDBPath(database, storage.toUtf8().constData());
    }
    if (status != TAMSA_OK) {
        std::fprintf(stderr, "delvix-host seed: cannot open the store in %s (status %x)\n",
                     qUtf8Printable(storage), unsigned(status));
        Tamsa_ReleaseDatabase(&database);
        return 1;
    }

    tamsa::TamsaSeedOptions seedOptions;
    seedOptions.objects = options.objects;
    seedOptions.locations = options.locations;
    seedOptions.seed = options.seed;
    const tamsa::TamsaSeeder seeder(seedOptions);
    std::printf("Seeding %llu objects over %u locations (seed %u, %u identities) into %s\n",
                static_cast<unsigned long long>(options.objects), options.locations, options.seed,
                seeder.identityCount(), qUtf8Printable(storage));
    std::fflush(stdout);

    QElapsedTimer timer;
    timer.start();
    qint64 lastPrint = 0;
    const tamsa::TamsaSeedReport report = seeder.seed(database, [&](uint64_t stored) {
        const qint64 now = timer.elapsed();
        if (now - lastPrint >= 2000) {
            lastPrint = now;
            std::printf("  %llu / %llu objects, %.0f objects/s\n", static_cast<unsigned long long>(stored),
                        static_cast<unsigned long long>(options.objects),
                        double(stored) * 1000.0 / double(now));
            std::fflush(stdout);
        }
    });
    Tamsa_ReleaseDatabase(&database);
    const double seconds = double(timer.elapsed()) / 1000.0;
    if (report.status != 0) {
        std::fprintf(stderr, "delvix-host seed: ingest failed with status %x after %llu objects\n",
                     unsigned(report.status), static_cast<unsigned long long>(report.stored));
        return 1;
    }
    std::printf(
        "Stored %llu objects (%llu people, %llu vehicles) in %.1f s (%.0f objects/s); store size %.2f GB\n",
        static_cast<unsigned long long>(report.stored), static_cast<unsigned long long>(report.people),
        static_cast<unsigned long long>(report.vehicles), seconds, double(report.stored) / seconds,
        double(folderBytes(storage)) / 1e9);
    return 0;
}

#pragma once
// The case vault: investigation cases and the items filed under them, in one SQLite file
// "<database path>/PluginDelvix/CaseVault.db".
//
// Every operation opens the file, switches foreign-key enforcement on (the items of a deleted
// case go with it only then) and closes the file again; nothing holds it between operations.
// The "Case" table is mirrored in a case map, loaded at construction and afterwards changed only
// by addCase, updateCase and deleteCase, and only after their statement succeeded. Changes made
// to the file by anyone else are not seen until a new instance is constructed. The map is the one
// structure that grows with the vault for as long as the server runs: about 0.9 KB per case with
// short texts (the heap a vault of 10,000 cases holds, bench_CaseDatabase), plus its texts' length.
//
// Failures are values: 0 from the insertions, false, or empty results, each logged where it
// arises. Without a database path (the server-information plug-in missing) no file is made
// anywhere and every operation fails that way.
//
// Threads: any thread may call any operation. An instance and all its copies share the
// connection, the case map and one recursive lock; every public operation holds the lock from
// start to end, so that no operation's connection guard closes the file under another's query.
// It is recursive because the case detail calls the other virtual reads. Assigning to an
// instance while another thread uses that same instance is not supported, as for any value.
// Overrides that call back into the instance from another thread while an operation runs will
// wait for it.

#include <QList>
#include <QMap>
#include <QSet>
#include <QString>
#include <QVariant>
#include <memory>
#include <mutex>
#include <utility>

class QSqlQuery;

class CaseDatabase
{
public:
    // An instance without a file: every file operation fails. The system itself does not use it.
    CaseDatabase();
    // Makes the folder and the tables as needed in the database path and loads the case map.
    explicit CaseDatabase(const QString& path);
    // Copies share the connection, the case map and the lock with the original; the connection
    // is removed from the driver's registry when the last of them goes.
    CaseDatabase(const CaseDatabase& other);
    CaseDatabase& operator=(const CaseDatabase& other);
    virtual ~CaseDatabase();

    // New case id, or 0 on failure.
    virtual int addCase(const QString& name, const QString& number, const QString& reporter);
    // New item id, or 0 on failure (also for a case the file does not hold).
    virtual int addCaseItem(int caseId, const QVariantMap& item);
    virtual bool updateCase(int caseId, const QVariantMap& fields);
    // False also when no item has that id.
    virtual bool updateCaseItem(int itemId, const QVariantMap& fields);
    // True when the statement ran, whether or not a row had that id.
    virtual bool deleteCase(int caseId);
    virtual bool deleteCaseItem(int itemId);
    // From the case map, without touching the file.
    virtual bool containCase(int caseId);

    // Case record with "coverImage", "startTimestamp" and "endTimestamp" added; empty when the
    // case map has no such case.
    virtual QVariantMap getCaseInfoMap(int caseId);
    // Case summaries ("caseId", "caseName", "createdTime"), newest first.
    virtual QVariantList getCaseList();
    // The cached case records in ascending id order.
    virtual QVariantList getAllCase();
    virtual QVariantList getCaseItemList(int caseId);
    virtual QSet<int> getCaseItemIdSet(int caseId);
    virtual QVariantMap getCaseItemInfoMap(int itemId);
    // Earliest item start and latest item end as "yyyy-MM-dd hh:mm" local time, "0" for none.
    virtual std::pair<QString, QString> getCaseDuration(int caseId);
    // Up to three images: at most three from type-0 items, or one from a type-1 item and one
    // from a type-0 item, in start-time order.
    virtual QList<QString> getCaseCoverImage(int caseId);

    // Holds the vault's lock for a command's read-modify-write sequence, so that no other
    // command's operations fall between its own (the lock is recursive: they still work).
    std::unique_lock<std::recursive_mutex> lockSequence() const;

private:
    class ConnectionGuard;
    struct Shared;

    bool initialTable();
    void initialCaseMap();
    bool executeSql(QSqlQuery& query, const QString& statement, const QList<QVariant>& values);

    QString m_folderPath;
    QString m_filePath;
    QString m_connectionName;
    // Connection handle, case map and lock, shared with every copy (see Shared for what the
    // lock guards); never null.
    std::shared_ptr<Shared> m_shared;
};

#pragma once
// Deterministic synthetic object metadata for the simulated cameras.
//
// A population of people and vehicles (fixed by the seed) walks past every camera: the same
// identity appears on many cameras with its own attributes, a thumbnail and a feature vector that
// differs from its base vector only by noise (cosine similarity about 0.9 to itself, about 0 to
// any other identity). What a camera answers for a window depends only on (seed, camera, window,
// rate), so repeated or overlapping requests see the same objects. Thread-safe after construction.

#include "AttributeVocabulary.h"

#include <QByteArray>
#include <QString>
#include <QVector>

class ObjectGenerator
{
public:
    static constexpr int kFeatureLength = 512;

    // Attribute codes are drawn from the vocabulary's lists, so a site's cameras only make codes
    // that its clients can put in words.
    explicit ObjectGenerator(quint64 seed = 1, int people = 40, int vehicles = 20,
                             AttributeVocabulary vocabulary = AttributeVocabulary::defaults());

    // The camera answer for the objects that start in [start, end) on this camera, at about
    // objectsPerMinute objects a minute: {"ObjectMetaInfo": [...]}.
    QByteArray answer(const QString& camera, qint64 start, qint64 end, int objectsPerMinute) const;
    // How many objects that answer holds.
    int objectCount(const QString& camera, qint64 start, qint64 end, int objectsPerMinute) const;

    int populationSize() const { return m_people + m_vehicles; }
    bool isPerson(int identity) const { return identity < m_people; }
    // The noise-free body feature of an identity (unit length).
    const QVector<float>& baseFeature(int identity) const { return m_bodyFeatures[identity]; }
    // The identity of object `index` (0-based) of that answer, for tests that follow people around.
    int identityOf(const QString& camera, qint64 start, qint64 end, int objectsPerMinute, int index) const;

    static quint64 cameraHash(const QString& camera);

private:
    struct Slot
    {
        qint64 second;
        int k;
    };
    QVector<Slot> objectSlots(const QString& camera, qint64 start, qint64 end, int objectsPerMinute) const;
    void appendObject(QByteArray& out, quint64 cameraKey, const Slot& slot) const;

    quint64 m_seed;
    AttributeVocabulary m_vocabulary;
    int m_people;
    int m_vehicles;
    QVector<QVector<float>> m_bodyFeatures; // per identity
    QVector<QVector<float>> m_faceFeatures; // per identity (people only)
    QVector<QByteArray> m_thumbnails;       // per identity: base64 PNG
};

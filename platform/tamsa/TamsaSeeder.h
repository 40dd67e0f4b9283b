#pragma once
// Deterministic synthetic camera answers for benchmarks and the `delvix-host seed` command.
//
// People carry 512-float body and face vectors drawn from a population of identities that
// reappear across locations: each vector is its identity's vector plus noise, so two sightings
// of one identity have a cosine of about 0.75 (and against the identity itself about 0.87),
// while different identities stay near 0. Vehicles carry plates. Every object has a small real
// PNG thumbnail and a trajectory. The same options always give the same answers.

#include <cstdint>
#include <functional>
#include <string>
#include <vector>

namespace tamsa {

struct TamsaSeedOptions
{
    uint64_t objects = 10000;
    uint32_t locations = 10;
    uint32_t seed = 1;
    uint32_t firstTime = 1704067200; // 2024-01-01 00:00 UTC
    uint32_t spanSeconds = 4 * 3600; // each location's objects spread over this window (busy cameras)
    uint32_t batchSize = 500;        // objects per camera answer
};

struct TamsaSeedReport
{
    uint64_t stored = 0;
    uint64_t people = 0;
    uint64_t vehicles = 0;
    int32_t status = 0; // 0, or the first failing ingest status
};

class TamsaSeeder
{
public:
    explicit TamsaSeeder(const TamsaSeedOptions& options);

    const TamsaSeedOptions& options() const { return m_options; }
    uint32_t identityCount() const { return m_identities; }
    // Objects a location gets (locations are numbered 1..locations).
    uint64_t objectsAt(uint32_t location) const;
    // The camera answer for objects [first, first + count) of a location, in time order.
    std::string answer(uint32_t location, uint64_t first, uint32_t count) const;
    // The clean identity vectors (queries use them to find an identity's sightings).
    std::vector<float> identityBody(uint32_t identity) const;
    std::vector<float> identityFace(uint32_t identity) const;
    // Where and when object `index` of a location is, and whom it shows (people only).
    bool isPerson(uint32_t location, uint64_t index) const;
    uint32_t identityOf(uint32_t location, uint64_t index) const;
    uint32_t startTimeOf(uint32_t location, uint64_t index) const;

    // Fills a store through Tamsa_PutObjectMetaInfo on `database`, generating the next answers
    // on a second thread while one is stored. `progress` gets the count stored so far.
    TamsaSeedReport seed(void* database, const std::function<void(uint64_t)>& progress = {}) const;

    // A tiny valid PNG (8x8, one colour), base64.
    static std::string pngBase64(uint8_t red, uint8_t green, uint8_t blue);

private:
    void appendPerson(std::string* out, uint32_t location, uint64_t index, uint64_t random) const;
    void appendVehicle(std::string* out, uint32_t location, uint64_t index, uint64_t random) const;

    TamsaSeedOptions m_options;
    uint32_t m_identities = 1;
    std::vector<std::string> m_colourImages;
    // Identity vectors, made once (each sighting is a noisy copy): identities x 512 floats.
    std::vector<float> m_bodies;
    std::vector<float> m_faces;
};

} // namespace tamsa

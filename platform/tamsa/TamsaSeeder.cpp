#include "TamsaSeeder.h"

#include "Tamsa.h"

#include <QByteArray>

#include <algorithm>
#include <cmath>
#include <condition_variable>
#include <cstring>
#include <deque>
#include <mutex>
#include <thread>

namespace tamsa {

namespace {

constexpr size_t kDim = 512;
constexpr uint32_t kMaxIdentities = 20000;
constexpr uint32_t kSightingsPerIdentity = 20;
// Per-element noise: a noise vector of norm 0.6 against a unit identity vector.
const float kNoiseHalfWidth = float(0.6 / std::sqrt(double(kDim)) * std::sqrt(3.0));

uint64_t mix(uint64_t x)
{
    // splitmix64: every (seed, location, index) gets an independent stream
    x += 0x9E3779B97F4A7C15ull;
    x = (x ^ (x >> 30)) * 0xBF58476D1CE4E5B9ull;
    x = (x ^ (x >> 27)) * 0x94D049BB133111EBull;
    return x ^ (x >> 31);
}

class Random
{
public:
    explicit Random(uint64_t seed)
        : m_state(seed)
    {}
    uint64_t next() { return m_state = mix(m_state); }
    uint32_t below(uint32_t bound) { return uint32_t((next() >> 32) % bound); }
    double unit() { return double(next() >> 11) * (1.0 / 9007199254740992.0); }

private:
    uint64_t m_state;
};

std::vector<float> gaussianUnitVector(uint64_t seed)
{
    Random random(seed);
    std::vector<float> vector(kDim);
    double norm = 0;
    for (size_t i = 0; i < kDim; i += 2) {
        const double radius = std::sqrt(-2.0 * std::log(std::max(random.unit(), 1e-300)));
        const double angle = 6.283185307179586 * random.unit();
        vector[i] = float(radius * std::cos(angle));
        vector[i + 1] = float(radius * std::sin(angle));
        norm += double(vector[i]) * vector[i] + double(vector[i + 1]) * vector[i + 1];
    }
    const float scale = float(1.0 / std::sqrt(norm));
    for (float& value : vector) {
        value *= scale;
    }
    return vector;
}

// Six decimals: what a camera's JSON typically carries, and cheap to write.
void appendFixed6(std::string* out, double value)
{
    const long long scaled = (long long)(value * 1e6 + (value < 0 ? -0.5 : 0.5));
    char buffer[32];
    char* p = buffer + sizeof buffer;
    const bool negative = scaled < 0;
    unsigned long long magnitude = negative ? (unsigned long long)(-scaled) : (unsigned long long)scaled;
    for (int digit = 0; digit < 6; ++digit) {
        *--p = char('0' + magnitude % 10);
        magnitude /= 10;
    }
    *--p = '.';
    do {
        *--p = char('0' + magnitude % 10);
        magnitude /= 10;
    } while (magnitude);
    if (negative) {
        *--p = '-';
    }
    out->append(p, size_t(buffer + sizeof buffer - p));
}

void appendNoisyVector(std::string* out, const float* identity, Random* random)
{
    out->push_back('[');
    for (size_t i = 0; i < kDim; ++i) {
        if (i) {
            out->push_back(',');
        }
        const double noise = (random->unit() * 2.0 - 1.0) * kNoiseHalfWidth;
        appendFixed6(out, identity[i] + noise);
    }
    out->push_back(']');
}

void appendTrajectory(std::string* out, Random* random)
{
    const uint32_t points = 4 + random->below(9);
    double x = random->unit();
    double y = random->unit();
    const double dx = (random->unit() - 0.5) * 0.2;
    const double dy = (random->unit() - 0.5) * 0.2;
    out->append(",\"Trajectory\":[");
    for (uint32_t i = 0; i < points; ++i) {
        if (i) {
            out->push_back(',');
        }
        out->append("{\"x\":");
        appendFixed6(out, std::clamp(x, 0.0, 1.0));
        out->append(",\"y\":");
        appendFixed6(out, std::clamp(y, 0.0, 1.0));
        out->push_back('}');
        x += dx + (random->unit() - 0.5) * 0.02;
        y += dy + (random->unit() - 0.5) * 0.02;
    }
    out->push_back(']');
}

void appendNumberList(std::string* out, Random* random, uint32_t minCount, uint32_t maxCount, uint32_t values)
{
    const uint32_t count = minCount + random->below(maxCount - minCount + 1);
    out->push_back('[');
    uint32_t used = 0;
    for (uint32_t i = 0; i < count; ++i) {
        uint32_t value = random->below(values);
        if (used & (1u << value)) {
            continue; // no repeats within one list
        }
        used |= 1u << value;
        if (out->back() != '[') {
            out->push_back(',');
        }
        out->append(std::to_string(value));
    }
    out->push_back(']');
}

uint32_t crc32(const uint8_t* data, size_t length, uint32_t crc = 0)
{
    crc = ~crc;
    for (size_t i = 0; i < length; ++i) {
        crc ^= data[i];
        for (int bit = 0; bit < 8; ++bit) {
            crc = (crc >> 1) ^ (0xEDB88320u & (0u - (crc & 1u)));
        }
    }
    return ~crc;
}

void appendBigEndian(std::vector<uint8_t>* out, uint32_t value)
{
    for (int shift = 24; shift >= 0; shift -= 8) {
        out->push_back(uint8_t(value >> shift));
    }
}

void appendChunk(std::vector<uint8_t>* png, const char* type, const std::vector<uint8_t>& data)
{
    appendBigEndian(png, uint32_t(data.size()));
    std::vector<uint8_t> typed(type, type + 4);
    typed.insert(typed.end(), data.begin(), data.end());
    png->insert(png->end(), typed.begin(), typed.end());
    appendBigEndian(png, crc32(typed.data(), typed.size()));
}

const char* const kAges[] = {"Child", "Young", "Adult", "Senior"};
const uint8_t kPalette[10][3] = {{20, 20, 20},    {240, 240, 240}, {200, 30, 30},   {30, 160, 60},
                                 {40, 60, 200},   {230, 200, 40},  {130, 130, 130}, {120, 70, 30},
                                 {230, 120, 180}, {150, 60, 170}};

} // namespace

std::string TamsaSeeder::pngBase64(uint8_t red, uint8_t green, uint8_t blue)
{
    constexpr uint32_t side = 8;
    std::vector<uint8_t> raw;
    for (uint32_t row = 0; row < side; ++row) {
        raw.push_back(0); // filter: none
        for (uint32_t column = 0; column < side; ++column) {
            raw.insert(raw.end(), {red, green, blue});
        }
    }
    // zlib stream with one stored (uncompressed) deflate block
    std::vector<uint8_t> zlib = {0x78,
                                 0x01,
                                 0x01,
                                 uint8_t(raw.size() & 0xFF),
                                 uint8_t(raw.size() >> 8),
                                 uint8_t(~raw.size() & 0xFF),
                                 uint8_t((~raw.size() >> 8) & 0xFF)};
    zlib.insert(zlib.end(), raw.begin(), raw.end());
    uint32_t a = 1, b = 0;
    for (uint8_t byte : raw) {
        a = (a + byte) % 65521;
        b = (b + a) % 65521;
    }
    appendBigEndian(&zlib, (b << 16) | a);

    std::vector<uint8_t> png = {0x89, 'P', 'N', 'G', '\r', '\n', 0x1A, '\n'};
    std::vector<uint8_t> header;
    appendBigEndian(&header, side);
    appendBigEndian(&header, side);
    header.insert(header.end(), {8, 2, 0, 0, 0}); // 8-bit RGB
    appendChunk(&png, "IHDR", header);
    appendChunk(&png, "IDAT", zlib);
    appendChunk(&png, "IEND", {});
    return QByteArray(reinterpret_cast<const char*>(png.data()), qsizetype(png.size()))
        .toBase64()
        .toStdString();
}

TamsaSeeder::TamsaSeeder(const TamsaSeedOptions& options)
    : m_options(options)
{
    m_options.locations = std::max<uint32_t>(1, m_options.locations);
    m_options.batchSize = std::max<uint32_t>(1, m_options.batchSize);
    const uint64_t people = m_options.objects * 7 / 10;
    m_identities = uint32_t(std::clamp<uint64_t>(people / kSightingsPerIdentity, 1, kMaxIdentities));
    for (const auto& colour : kPalette) {
        m_colourImages.push_back(pngBase64(colour[0], colour[1], colour[2]));
    }
    m_bodies.resize(size_t(m_identities) * kDim);
    m_faces.resize(size_t(m_identities) * kDim);
    for (uint32_t identity = 0; identity < m_identities; ++identity) {
        const std::vector<float> body =
            gaussianUnitVector(mix(mix(m_options.seed) ^ (uint64_t(identity) << 1)));
        const std::vector<float> face =
            gaussianUnitVector(mix(mix(m_options.seed) ^ ((uint64_t(identity) << 1) | 1)));
        std::copy(body.begin(), body.end(), m_bodies.begin() + std::ptrdiff_t(identity * kDim));
        std::copy(face.begin(), face.end(), m_faces.begin() + std::ptrdiff_t(identity * kDim));
    }
}

uint64_t TamsaSeeder::objectsAt(uint32_t location) const
{
    if (location == 0 || location > m_options.locations) {
        return 0;
    }
    const uint64_t base = m_options.objects / m_options.locations;
    return base + (location <= m_options.objects % m_options.locations ? 1 : 0);
}

std::vector<float> TamsaSeeder::identityBody(uint32_t identity) const
{
    const auto begin = m_bodies.begin() + std::ptrdiff_t(size_t(identity % m_identities) * kDim);
    return std::vector<float>(begin, begin + kDim);
}

std::vector<float> TamsaSeeder::identityFace(uint32_t identity) const
{
    const auto begin = m_faces.begin() + std::ptrdiff_t(size_t(identity % m_identities) * kDim);
    return std::vector<float>(begin, begin + kDim);
}

static uint64_t objectSeed(uint32_t seed, uint32_t location, uint64_t index)
{
    return mix(mix(mix(seed) ^ location) ^ index);
}

bool TamsaSeeder::isPerson(uint32_t location, uint64_t index) const
{
    return objectSeed(m_options.seed, location, index) % 10 < 7;
}

uint32_t TamsaSeeder::identityOf(uint32_t location, uint64_t index) const
{
    return uint32_t((objectSeed(m_options.seed, location, index) >> 8) % m_identities);
}

uint32_t TamsaSeeder::startTimeOf(uint32_t location, uint64_t index) const
{
    const uint64_t count = std::max<uint64_t>(1, objectsAt(location));
    return m_options.firstTime + uint32_t(index * m_options.spanSeconds / count);
}

void TamsaSeeder::appendPerson(std::string* out, uint32_t location, uint64_t index, uint64_t seed) const
{
    Random random(seed ^ 0x5045525355ull);
    const uint32_t identity = identityOf(location, index);
    out->append(",\"ObjectType\":\"Human\"");
    const uint32_t start = startTimeOf(location, index);
    out->append(",\"StartTime\":" + std::to_string(start) +
                ",\"EndTime\":" + std::to_string(start + 2 + random.below(58)));
    // Gender and age follow the identity, clothes vary between sightings.
    Random person(mix(identity + 1000003ull * m_options.seed));
    out->append(",\"Attributes\":{\"Age\":\"");
    out->append(kAges[person.below(4)]);
    out->append("\",\"Gender\":" + std::to_string(person.below(2)) + ",\"Accessories\":");
    appendNumberList(out, &random, 0, 2, 6);
    out->append(",\"UpperColor\":");
    const size_t upperAt = out->size() + 1;
    appendNumberList(out, &random, 1, 2, 10);
    const uint32_t upper = uint32_t((*out)[upperAt] - '0');
    out->append(",\"LowerColor\":");
    appendNumberList(out, &random, 1, 1, 10);
    out->push_back('}');
    appendTrajectory(out, &random);
    out->append(",\"Thumbnail\":[{\"image\":\"");
    out->append(m_colourImages[upper % m_colourImages.size()]);
    out->append("\",\"feature\":");
    appendNoisyVector(out, m_bodies.data() + size_t(identity) * kDim, &random);
    out->append("}]");
    if (random.below(10) < 6) {
        out->append(",\"FaceThumbnail\":[{\"image\":\"");
        out->append(m_colourImages[8]);
        out->append("\",\"feature\":");
        appendNoisyVector(out, m_faces.data() + size_t(identity) * kDim, &random);
        out->append(",\"face_detection_info\":{\"filtered\":");
        out->append(random.below(10) == 0 ? "1" : "0");
        out->append("}}]");
    }
}

void TamsaSeeder::appendVehicle(std::string* out, uint32_t location, uint64_t index, uint64_t seed) const
{
    Random random(seed ^ 0x56454849ull);
    out->append(",\"ObjectType\":\"Vehicle\"");
    const uint32_t start = startTimeOf(location, index);
    out->append(",\"StartTime\":" + std::to_string(start) +
                ",\"EndTime\":" + std::to_string(start + 1 + random.below(30)));
    std::string plate;
    for (int i = 0; i < 3; ++i) {
        plate.push_back(char('A' + random.below(26)));
    }
    plate.push_back('-');
    for (int i = 0; i < 4; ++i) {
        plate.push_back(char('0' + random.below(10)));
    }
    const uint32_t colour = random.below(10);
    out->append(",\"Attributes\":{\"Type\":" + std::to_string(random.below(6)) + ",\"Color\":[" +
                std::to_string(colour) + "],\"PlateNumber\":\"" + plate + "\"}");
    appendTrajectory(out, &random);
    out->append(",\"Thumbnail\":[{\"image\":\"");
    out->append(m_colourImages[colour]);
    out->append("\"}],\"LicensePlateThumbnail\":[{\"image\":\"");
    out->append(m_colourImages[1]);
    out->append("\",\"PlateNumber\":\"" + plate + "\",\"detection_info\":{\"filtered\":0}}]");
}

std::string TamsaSeeder::answer(uint32_t location, uint64_t first, uint32_t count) const
{
    std::string out;
    out.reserve(size_t(count) * 12000);
    out.append("{\"ObjectMetaInfo\":[");
    const uint64_t end = std::min<uint64_t>(first + count, objectsAt(location));
    for (uint64_t index = first; index < end; ++index) {
        if (index != first) {
            out.push_back(',');
        }
        out.append("{\"ID\":" + std::to_string(index + 1));
        const uint64_t seed = objectSeed(m_options.seed, location, index);
        if (isPerson(location, index)) {
            appendPerson(&out, location, index, seed);
        } else {
            appendVehicle(&out, location, index, seed);
        }
        out.push_back('}');
    }
    out.append("]}");
    return out;
}

TamsaSeedReport TamsaSeeder::seed(void* database, const std::function<void(uint64_t)>& progress) const
{
    struct Batch
    {
        uint32_t location;
        uint64_t people;
        uint64_t vehicles;
        std::string json;
    };
    std::mutex mutex;
    std::condition_variable changed;
    std::deque<Batch> ready; // guarded by mutex
    bool done = false;       // guarded by mutex
    bool stop = false;       // guarded by mutex
    constexpr size_t kQueueDepth = 3;

    // Answers go round the locations batch by batch, so each camera's IDs grow with time.
    std::thread generator([&]() {
        uint64_t longest = 0;
        for (uint32_t location = 1; location <= m_options.locations; ++location) {
            longest = std::max(longest, objectsAt(location));
        }
        for (uint64_t first = 0; first < longest; first += m_options.batchSize) {
            for (uint32_t location = 1; location <= m_options.locations; ++location) {
                if (first >= objectsAt(location)) {
                    continue;
                }
                Batch batch{location, 0, 0, answer(location, first, m_options.batchSize)};
                const uint64_t end = std::min<uint64_t>(first + m_options.batchSize, objectsAt(location));
                for (uint64_t index = first; index < end; ++index) {
                    (isPerson(location, index) ? batch.people : batch.vehicles) += 1;
                }
                std::unique_lock<std::mutex> lock(mutex);
                changed.wait(lock, [&] { return ready.size() < kQueueDepth || stop; });
                if (stop) {
                    return;
                }
                ready.push_back(std::move(batch));
                changed.notify_all();
            }
        }
        std::lock_guard<std::mutex> lock(mutex);
        done = true;
        changed.notify_all();
    });

    TamsaSeedReport report;
    for (;;) {
        Batch batch;
        {
            std::unique_lock<std::mutex> lock(mutex);
            changed.wait(lock, [&] { return !ready.empty() || done; });
            if (ready.empty()) {
                break;
            }
            batch = std::move(ready.front());
            ready.pop_front();
            changed.notify_all();
        }
        const int32_t stored =
            Tamsa_PutObjectMetaInfo(database, 1, int32_t(batch.location), batch.json.c_str());
        if (stored < 0) {
            report.status = stored;
            std::lock_guard<std::mutex> lock(mutex);
            stop = true;
            changed.notify_all();
            break;
        }
        report.stored += uint64_t(stored);
        report.people += batch.people;
        report.vehicles += batch.vehicles;
        if (progress) {
            progress(report.stored);
        }
    }
    generator.join();
    return report;
}

} // namespace tamsa

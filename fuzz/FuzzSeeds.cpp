// Writes the seed inputs of the fuzzers: real records and images of the
// module's classes, taken from a small committed offset map, and a few
// ops-file lines.
//
//   FuzzSeeds <corpus directory>
// creates <dir>/<target>/seed-<n> for ImageRecordFuzz, LoaderFuzz,
// ImageReaderFuzz and OpsLineFuzz (see each target for its input format).

#include <cstdio>
#include <filesystem>
#include <fstream>
#include <string>
#include <vector>

#include "fuzz/FuzzStore.h"
#include "tnBackends/MemoryStore.h"
#include "tools/OpsFile.h"

namespace {

using namespace tarn;
using Bytes = std::vector<octet_t>;

void WriteSeed(const std::filesystem::path& dir, int n, const Bytes& bytes) {
    std::filesystem::create_directories(dir);
    std::ofstream out(dir / ("seed-" + std::to_string(n)), std::ios::binary);
    out.write(reinterpret_cast<const char*>(bytes.data()),
              static_cast<std::streamsize>(bytes.size()));
}

int ClassIndex(const std::string& name) {
    for (int i = 0; i < 4; ++i) {
        if (name == fuzz::kClassNames[i]) {
            return i;
        }
    }
    std::abort();
}

FieldId Key(uint64 i) {
    const octet_t path[3] = {static_cast<octet_t>(i >> 8), static_cast<octet_t>(i), 0x5a};
    return FieldId(OID(Seid(uint64{40 + i % 3})), Path(path, 2 + static_cast<ssize_t>(i % 2)));
}

// The images of a record holding `numKeys` fields, in identity order 1, 2, ...
std::vector<StoredImage> CommittedImages(int numKeys) {
    auto store = std::make_shared<MemoryStore>();
    {
        CSpace space(store);
        CSpaceGuard guard(space, LockMode::Exclusive);
        OffsetOps* rec = CreatePersistent<OffsetOps>();
        Guid site{};
        for (int i = 0; i < numKeys; ++i) {
            site.Data1 = 1 + static_cast<uint32>(i % 2);
            rec->RecordOffset(Opid(site, i), Key(static_cast<uint64>(i)), i - 3);
        }
        space.Commit();
    }
    std::vector<StoredImage> images;
    store->ForEachIdentity([&](uint64 oid) {
        if (oid != images.size() + 1) {
            std::abort();  // the seeds rely on identities 1, 2, ... in order
        }
        images.push_back(*store->Load(oid));
    });
    return images;
}

}  // namespace

int main(int argc, char** argv) {
    if (argc != 2) {
        std::fprintf(stderr, "usage: FuzzSeeds <corpus directory>\n");
        return 2;
    }
    const std::filesystem::path root = argv[1];
    int recordSeed = 0;
    int loaderSeed = 0;
    int readerSeed = 0;
    for (int numKeys : {0, 3, 150}) {
        const std::vector<StoredImage> images = CommittedImages(numKeys);
        Bytes loader = {0};
        Bytes reader;
        for (std::size_t i = 0; i < images.size(); ++i) {
            const StoredImage& image = images[i];
            WriteSeed(root / "ImageRecordFuzz", recordSeed++, EncodeImageRecord(7, image));
            const Bytes record = EncodeImageRecord(i + 1, image);
            loader.insert(loader.end(), record.begin(), record.end());
            const std::size_t length = image.bytes.size() - 1;  // without the schema number
            reader.push_back(static_cast<octet_t>(ClassIndex(image.className)));
            reader.push_back(static_cast<octet_t>(length));
            reader.push_back(static_cast<octet_t>(length >> 8));
            reader.insert(reader.end(), image.bytes.begin() + 1, image.bytes.end());
        }
        WriteSeed(root / "LoaderFuzz", loaderSeed++, loader);
        WriteSeed(root / "ImageReaderFuzz", readerSeed++, reader);
    }

    tool::OffsetOperation op;
    op.site = *ParseGuid("0123abcd-0000-4000-8000-00000000002a");
    op.t = 17;
    op.field = Key(258);
    op.offset = -5;
    const std::vector<std::string> lines = {
        tool::FormatOpsLine(op),
        " 0123abcd-0000-4000-8000-00000000002a , 4294967295 , 18446744073709551615 , , "
        "-9223372036854775808 # comment\r",
        "# only a comment",
        "",
        "0123abcd-0000-4000-8000-00000000002a,1,0,00,1",
        "#12/0a0b",
        tool::FormatOpsLine(op) + "\n" + tool::FormatOpsLine(op) + "\nbad line\n",
    };
    for (std::size_t i = 0; i < lines.size(); ++i) {
        WriteSeed(root / "OpsLineFuzz", static_cast<int>(i),
                  Bytes(lines[i].begin(), lines[i].end()));
    }
    return 0;
}

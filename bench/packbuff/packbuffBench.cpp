// Cost of building and walking an upcall reply with the packed buffer, against a plain
// memcpy of the same bytes: the least any reply transport has to do.
//
// The reply is a typical one: home, data and tmp paths, four app-group pairs, a system
// container and the status, in 4,096-byte blocks as the upcall server uses them. Both
// sides run in the same process, one after the other; the medians of their repetitions
// give the ratio.
//
// Usage: stowly_bench_packbuff [--quick] [Google Benchmark options]

#include "src/packbuff/packbuff.h"

#include <benchmark/benchmark.h>

#include <cstdio>
#include <cstring>
#include <map>
#include <string>
#include <unistd.h>
#include <vector>

namespace {

struct Reply {
    std::string home = "/private/var/mobile";
    std::string data = "/private/var/mobile/Containers/Data/Application/6F1C2A7E-3B9D-4E21-9A55-0C7D8E3F4B12";
    std::string tmp = data + "/tmp";
    std::vector<std::pair<std::string, std::string>> groups;
    std::string system = "/private/var/containers/Data/System/1D4E8B2C-7A3F-4C65-B0E9-5F2A6D8C9E03";

    Reply() {
        for (int i = 0; i < 4; ++i)
            groups.emplace_back(
                "group.com.example.shared" + std::to_string(i),
                "/private/var/mobile/Containers/Shared/AppGroup/A3B5C7D9-0E2F-4A6B-8C1D-3E5F7A9B0C2" +
                    std::to_string(i));
    }
};

const Reply& reply() {
    static const Reply r;
    return r;
}

sb_packbuff* packReply(const Reply& r) {
    sb_packbuff* pb = sb_packbuff_new(4096);
    int error = sb_packbuff_pack_string(pb, 100, r.home.c_str(), r.home.size());
    error |= sb_packbuff_pack_string(pb, 1, r.data.c_str(), r.data.size());
    error |= sb_packbuff_pack_string(pb, 2, r.tmp.c_str(), r.tmp.size());
    for (const auto& [identifier, path] : r.groups)
        error |= sb_packbuff_pack_key_with_string_value(pb, 3, identifier.c_str(), 4, path.c_str());
    error |= sb_packbuff_pack_string(pb, 101, r.system.c_str(), r.system.size());
    error |= sb_packbuff_pack_uint32(pb, 0, 1);
    if (error != 0) {
        fprintf(stderr, "packing the reply failed\n");
        std::exit(1);
    }
    return pb;
}

// Reads every item the way the kernel side does; returns a sum so nothing is skipped.
size_t walkReply(void* bytes, size_t size) {
    sb_packbuff* pb = sb_packbuff_init_with_buffer(bytes, size, true, SB_PACKBUFF_DEALLOC_NONE);
    size_t sum = 0;
    uint16_t tag;
    int error = 0;
    while (error == 0 && sb_packbuff_get_item_value_type(pb, &tag)) {
        size_t length = 0;
        if (tag == 0) {
            sum += sb_packbuff_unpack_uint32(pb, &error);
        } else if (tag == 3) {
            const char* key;
            const char* value;
            uint16_t valueType;
            error = sb_packbuff_unpack_key_with_string_value(pb, &key, &valueType, &value, &length);
            sum += length + valueType + static_cast<unsigned char>(key[0]);
        } else {
            const char* path = sb_packbuff_unpack_string(pb, &length, &error);
            sum += length + static_cast<unsigned char>(path ? path[0] : 0);
        }
    }
    sb_packbuff_free(pb);
    if (error != 0) {
        fprintf(stderr, "walking the reply failed: %d\n", error);
        std::exit(1);
    }
    return sum;
}

void BM_PackbuffUpcallReply(benchmark::State& state) {
    const Reply& r = reply();
    for (auto _ : state) {
        sb_packbuff* pb = packReply(r);
        benchmark::DoNotOptimize(walkReply(sb_packbuff_get_bytes(pb), sb_packbuff_get_size(pb)));
        sb_packbuff_free(pb);
    }
}

void BM_MemcpyUpcallReply(benchmark::State& state) {
    sb_packbuff* pb = packReply(reply());
    std::vector<char> source(static_cast<char*>(sb_packbuff_get_bytes(pb)),
                             static_cast<char*>(sb_packbuff_get_bytes(pb)) + sb_packbuff_get_size(pb));
    sb_packbuff_free(pb);
    std::vector<char> destination(source.size());
    for (auto _ : state) {
        benchmark::DoNotOptimize(source.data());
        memcpy(destination.data(), source.data(), source.size());
        benchmark::DoNotOptimize(destination.data());
        benchmark::ClobberMemory();
    }
    state.SetBytesProcessed(static_cast<int64_t>(state.iterations() * source.size()));
}

// Prints as usual and keeps the median CPU time per iteration of each benchmark: CPU time,
// so that a busy machine taking the core away does not count against either side.
class MedianReporter : public benchmark::ConsoleReporter {
public:
    MedianReporter() : ConsoleReporter(isatty(STDOUT_FILENO) ? OO_ColorTabular : OO_Tabular) {}
    void ReportRuns(const std::vector<Run>& runs) override {
        for (const Run& run : runs)
            if (run.run_type == Run::RT_Aggregate && run.aggregate_name == "median")
                medians[run.run_name.function_name] = run.GetAdjustedCPUTime();
        ConsoleReporter::ReportRuns(runs);
    }
    std::map<std::string, double> medians;
};

} // namespace

int main(int argc, char** argv) {
    bool quick = false;
    std::vector<char*> args;
    for (int i = 0; i < argc; ++i) {
        if (strcmp(argv[i], "--quick") == 0)
            quick = true;
        else
            args.push_back(argv[i]);
    }
    int count = static_cast<int>(args.size());
    benchmark::Initialize(&count, args.data());
    if (benchmark::ReportUnrecognizedArguments(count, args.data()))
        return 2;

    const double minTime = quick ? 0.1 : 0.8;
    const int repetitions = quick ? 3 : 5;
    for (auto* benchmark : {benchmark::RegisterBenchmark("BM_PackbuffUpcallReply", BM_PackbuffUpcallReply),
                            benchmark::RegisterBenchmark("BM_MemcpyUpcallReply", BM_MemcpyUpcallReply)})
        benchmark->MinTime(minTime)->Repetitions(repetitions)->ReportAggregatesOnly(true);

    sb_packbuff* pb = packReply(reply());
    printf("upcall reply: %zu bytes in %zu allocated\n", sb_packbuff_get_size(pb), pb->bytes_allocated);
    sb_packbuff_free(pb);
    fflush(stdout);

    MedianReporter reporter;
    benchmark::RunSpecifiedBenchmarks(&reporter);
    benchmark::Shutdown();

    double packbuff = reporter.medians["BM_PackbuffUpcallReply"];
    double copy = reporter.medians["BM_MemcpyUpcallReply"];
    if (packbuff <= 0 || copy <= 0) {
        fprintf(stderr, "a benchmark did not run\n");
        return 1;
    }
    printf("packbuff %.1f ns, memcpy %.1f ns per reply\n", packbuff, copy);
    printf("packbuff_upcall_reply: ratio %.2f (no goal)\n", packbuff / copy);
    return 0;
}

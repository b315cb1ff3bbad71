// A host that leaves to another what every host takes from the real machine: command line, files, streams,
// work queues and signals.
#pragma once

#include "platform/HXPlatform.h"

#include <utility>

class HXServicesPlatform : public HXPlatform {
  public:
    // `services` must outlive this host.
    explicit HXServicesPlatform(HXPlatform &services) : _services(services) {}

    HXOptionScan getopt_long(int argc, char *const argv[], const char *shortOptions,
                             const std::vector<HXLongOption> &options, bool restart) override {
        return _services.getopt_long(argc, argv, shortOptions, options, restart);
    }
    bool stat(const std::string &path) override { return _services.stat(path); }
    std::FILE *fopen(const std::string &path, const char *mode) override {
        return _services.fopen(path, mode);
    }
    std::optional<std::string> readFile(const std::string &path, uint64_t limit) override {
        return _services.readFile(path, limit);
    }
    std::optional<std::string> readFileStart(const std::string &path, size_t bytes) override {
        return _services.readFileStart(path, bytes);
    }
    std::optional<HXPendingFile> createPendingFile(const std::string &path) override {
        return _services.createPendingFile(path);
    }
    bool commitPendingFile(HXPendingFile &file) override { return _services.commitPendingFile(file); }
    void discardPendingFile(HXPendingFile &file) override { _services.discardPendingFile(file); }
    bool isatty(int descriptor) override { return _services.isatty(descriptor); }

    HXDispatchQueue dispatch_queue_create(const std::string &label, uint32_t qualityOfService) override {
        return _services.dispatch_queue_create(label, qualityOfService);
    }
    void dispatch_apply(size_t iterations, const HXDispatchQueue &queue,
                        const std::function<void(size_t)> &work) override {
        _services.dispatch_apply(iterations, queue, work);
    }
    std::unique_ptr<HXDispatchSource> dispatch_source_create(int signal) override {
        return _services.dispatch_source_create(signal);
    }
    void dispatch_source_set_event_handler(HXDispatchSource &source, std::function<void()> handler) override {
        _services.dispatch_source_set_event_handler(source, std::move(handler));
    }
    void dispatch_resume(HXDispatchSource &source) override { _services.dispatch_resume(source); }
    void dispatch_source_cancel(HXDispatchSource &source) override {
        _services.dispatch_source_cancel(source);
    }
    void signal(int signal, HXSignalDisposition disposition) override {
        _services.signal(signal, disposition);
    }

  private:
    HXPlatform &_services;
};

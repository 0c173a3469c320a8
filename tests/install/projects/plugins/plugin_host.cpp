// Loads plug-ins, unloads them and loads them again, in any order, beside messages of its own.
#include <dlfcn.h>
#include <google/protobuf/descriptor.h>
#include <host_messages.pb.h>

#include <cstdlib>
#include <initializer_list>
#include <iostream>
#include <string>

namespace {

void* load(const std::string& path) {
    void* const plugin = dlopen(path.c_str(), RTLD_NOW | RTLD_LOCAL);
    if (plugin == nullptr) {
        std::cout << dlerror() << '\n';
        std::exit(EXIT_FAILURE);
    }
    const auto use = reinterpret_cast<int (*)()>(dlsym(plugin, "useTheLibrary"));
    const auto* known =
        google::protobuf::DescriptorPool::generated_pool()->FindMessageTypeByName("krutil.protobuf.TextBaseEvent");
    host::Greeting greeting;
    greeting.set_text("hello");
    std::cout << path.substr(path.rfind('/') + 1) << ": " << use() << " bytes, "
              << (known == nullptr ? "unknown" : "known") << ", " << greeting.ShortDebugString() << '\n';
    return plugin;
}

}  // namespace

// plugin_host READER WRITER
int main(int, char** arguments) {
    const std::string reader = arguments[1];
    const std::string writer = arguments[2];
    for (const std::string& path : {reader, reader, writer}) {
        dlclose(load(path));
    }
    void* const first = load(reader);
    void* const second = load(writer);
    dlclose(first);
    dlclose(load(reader));
    dlclose(second);
    std::cout << "left\n";
}

// Lists a folder, then says what changes in it: follow FOLDER [STORAGE [STATE]]
#include <cindral/Client.h>

#include <cstdlib>
#include <iostream>

template <typename T>
T valueOf(cindral::Outcome<T> outcome) {
    if (outcome.ok()) return *std::move(outcome);
    std::cerr << "follow: " << outcome.error().message << "\n";
    std::exit(1);
}

int main(int argc, char** argv) {
    if (argc < 2) return std::cerr << "usage: follow FOLDER [STORAGE [STATE]]\n", 2;
    cindral::Client::Options options;
    if (argc > 2) options.storage = argv[2];
    if (argc > 3) options.state = argv[3];
    cindral::Client client = valueOf(cindral::Client::start(options));
    const std::string folder = valueOf(client.identifierAt(argv[1]));

    // The anchor comes first: what changes during the listing is told afterwards.
    std::string anchor = valueOf(client.anchor(folder));
    valueOf(client.monitor(folder));
    std::optional<std::string> page;
    do {
        cindral::ItemPage listed = valueOf(client.items(folder, page));
        for (const cindral::Item& item : listed.items) std::cout << "listed   " << item.filename << "\n";
        page = listed.nextPage;
    } while (page);

    while (true) {
        cindral::Changes changes = valueOf(client.changes(folder, anchor));
        for (const auto& [identifier, item] : changes.entries)
            std::cout << (item ? "updated  " + item->filename : "deleted  " + identifier) << "\n";
        anchor = changes.anchor;
        std::cout.flush();
        if (!changes.moreComing) valueOf(client.waitForSignal());
    }
}

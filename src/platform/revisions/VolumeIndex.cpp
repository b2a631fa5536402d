#include "platform/revisions/VolumeIndex.h"

namespace cindral {

void IndexChanges::add(Operation operation, std::string_view name) {
    operation.nameBegin = names_.size();
    operation.nameSize = name.size();
    operation.object.name = {};
    names_ += name;
    operations_.push_back(operation);
}

void IndexChanges::put(const IndexedObject& object) {
    add({.kind = Operation::Kind::put, .object = object}, object.name);
}

void IndexChanges::remove(FileID fileID) {
    add({.kind = Operation::Kind::remove, .object = {.fileID = fileID}}, {});
}

void IndexChanges::touch(FileID fileID) {
    add({.kind = Operation::Kind::touch, .object = {.fileID = fileID}}, {});
}

void IndexChanges::addName(FileID fileID, FileID parent, std::string_view name) {
    add({.kind = Operation::Kind::addName, .object = {.fileID = fileID, .parent = parent}}, name);
}

void IndexChanges::removeName(FileID fileID, FileID parent, std::string_view name) {
    add({.kind = Operation::Kind::removeName, .object = {.fileID = fileID, .parent = parent}}, name);
}

void IndexChanges::leave(FileID fileID, FileID folder) {
    add({.kind = Operation::Kind::leave, .object = {.fileID = fileID, .parent = folder}}, {});
}

void IndexChanges::handOver(DocumentID document, FileID to) {
    add({.kind = Operation::Kind::handOver, .object = {.fileID = to}, .document = document}, {});
}

}  // namespace cindral

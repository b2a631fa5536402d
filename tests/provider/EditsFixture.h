#pragma once

#include <functional>
#include <memory>
#include <optional>
#include <string>

#include "platform/foundation/Dispatch.h"
#include "provider/LocalTesselKit.h"
#include "provider/ProviderFixture.h"

namespace cindral::test {

/// A provider whose edits answer before the call returns, for sentences of one line.
class EditsTest : public ProviderTest {
protected:
    using ItemResult = Result<std::shared_ptr<const TesselItem>>;

    EditsTest();

    ItemResult import(const std::string& path, const TesselItemIdentifier& parent);
    ItemResult createDirectory(const std::string& name, const TesselItemIdentifier& parent);
    ItemResult rename(const TesselItemIdentifier& identifier, const std::string& name);
    ItemResult reparent(const TesselItemIdentifier& identifier, const TesselItemIdentifier& parent,
                        const std::optional<std::string>& name = std::nullopt);
    std::optional<KsError> remove(const TesselItemIdentifier& identifier);
    ItemResult trash(const TesselItemIdentifier& identifier);
    ItemResult untrash(const TesselItemIdentifier& identifier,
                       const std::optional<TesselItemIdentifier>& parent = std::nullopt);
    std::optional<KsError> sweep(const KsDate& date);
    ItemResult setLastUsedDate(const TesselItemIdentifier& identifier, const std::optional<KsDate>& date);
    ItemResult setTags(const TesselItemIdentifier& identifier, const std::vector<std::string>& tags);
    ItemResult setFavoriteRank(const TesselItemIdentifier& identifier, std::optional<std::int64_t> rank);

    /// The identifier of what is at the name; fails the test when there is none.
    TesselItemIdentifier identifier(std::string_view name);
    bool exists(std::string_view name) const;
    std::string contents(std::string_view name) const;
    /// An attribute of the item's file, as bytes; none when it is absent.
    std::optional<Bytes> attribute(std::string_view name, std::string_view attribute) const;
    void setAttribute(std::string_view name, std::string_view attribute, ByteView value) const;

    /// The error's domain and code as one text; "" for success.
    static std::string errorOf(const ItemResult& result);
    static std::string errorOf(const std::optional<KsError>& error);

    std::shared_ptr<LocalTesselKit> provider_;

    /// The answer of an edit that found its item, and then others made changes before it was done.
    ItemResult overtaken(const std::function<void(TesselExtension::ItemCompletion)>& edit,
                         const std::function<void()>& changes);
    std::optional<KsError> deletionOvertaken(const TesselItemIdentifier& identifier,
                                             const std::function<void()>& changes);

private:
    static ItemResult awaitItem(const std::function<void(TesselExtension::ItemCompletion)>& call,
                                const std::function<void()>& meanwhile = nullptr);
    static std::optional<KsError> awaitEnd(const std::function<void(TesselExtension::Completion)>& call,
                                           const std::function<void()>& meanwhile = nullptr);
};

/// Occupies the threads of the pool while it lives: what an edit has put there, having found its item, is done only then.
class HeldPool {
public:
    HeldPool();
    /// Lets the pool go on.
    ~HeldPool();
    HeldPool(const HeldPool&) = delete;
    HeldPool& operator=(const HeldPool&) = delete;

private:
    struct State;
    const std::shared_ptr<State> state_;
};

inline constexpr const char* kNoSuchItem = "TesselErrorDomain -1001";
inline constexpr const char* kCollision = "TesselErrorDomain -1003";
inline constexpr const char* kInvalidParameter = "TSErrorDomain 1";
inline constexpr const char* kItemNotFound = "TSErrorDomain 2";
inline constexpr const char* kNoSuchFile = "KsGeneralErrorDomain 260";
inline constexpr const char* kNoPermission = "KsGeneralErrorDomain 513";
inline constexpr const char* kInvalidItemIdentifier = "CindralProvider.LocalTesselKitError 0";
inline constexpr const char* kUnknownIdentifier = "fid=18446744073709551615";

}  // namespace cindral::test

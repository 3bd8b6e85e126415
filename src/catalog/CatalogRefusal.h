// Why a catalog was refused: a short reason that a status view can show after "catalog refused: ",
// and the detail that goes with it into the log. Every refusal of the catalog loader is one of
// these, made in one place, so callers never compose reasons of their own.
#pragma once

#include <string>

namespace tavrix::catalog {

enum class CatalogRefusalKind {
    FetchFailed,
    MissingSignature,
    BadSignature,
    UnknownKey,
    UnsignedNotAllowed,
    Expired,
    Rollback,
    Malformed,
};

class CatalogRefusal {
  public:
    CatalogRefusal() = default;
    CatalogRefusal(CatalogRefusalKind kind, std::string detail)
        : kind_(kind), detail_(std::move(detail)) {}

    CatalogRefusalKind kind() const { return kind_; }
    // "expired", "rollback", "bad signature", ...: a few words, stable, for people and scripts.
    const char* reason() const;
    // The reason and its detail, as one log line says it.
    std::string what() const { return std::string(reason()) + ": " + detail_; }

  private:
    CatalogRefusalKind kind_ = CatalogRefusalKind::FetchFailed;
    std::string detail_;
};

inline const char* CatalogRefusal::reason() const {
    switch (kind_) {
        case CatalogRefusalKind::FetchFailed:
            return "fetch failed";
        case CatalogRefusalKind::MissingSignature:
            return "missing signature";
        case CatalogRefusalKind::BadSignature:
            return "bad signature";
        case CatalogRefusalKind::UnknownKey:
            return "unknown key";
        case CatalogRefusalKind::UnsignedNotAllowed:
            return "unsigned not allowed";
        case CatalogRefusalKind::Expired:
            return "expired";
        case CatalogRefusalKind::Rollback:
            return "rollback";
        case CatalogRefusalKind::Malformed:
            return "malformed";
    }
    return "refused";
}

}  // namespace tavrix::catalog

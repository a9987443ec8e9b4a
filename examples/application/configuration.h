#pragma once

// Thumbnails and pages are everybody's; drafts belong to the account that is logged in.
inline constexpr char kConfiguration[] = R"({
  "media": {"area": "caches", "session_scoped": false, "max_size": "60MB", "stores": {
    "thumbnails": {"type": "disk_cache", "lru_size_limit": "40MB"},
    "web": {"type": "unmanaged", "max_size": "20MB"}}},
  "letters": {"area": "documents", "stores": {
    "drafts": {"type": "pkvs", "durability": "safe"}}}
})";

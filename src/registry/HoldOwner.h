#pragma once
// What a hold knows of the client that took it: whether the client still
// accepts work. The client is referred to weakly; a hold never keeps it alive.

class HoldOwner {
public:
    virtual ~HoldOwner() = default;
    // False once the client's connection was reported invalid; never true again.
    virtual bool acceptWork() const noexcept = 0;
};

@0xd6ba1c4f0e2f7a93;

interface Echo {
    call @0 (number :Float64) -> (number :Float64);
    block @1 (block :Data) -> (block :Data);
}

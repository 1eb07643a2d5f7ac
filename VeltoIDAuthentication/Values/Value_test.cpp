// Value

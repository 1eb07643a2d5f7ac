// Base64
